#include "tools/check-extension/StartedExtension.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <system_error>
#include <utility>

#include "platform/linux/HostErrors.h"
#include "platform/linux/extensions/OutputLines.h"
#include "providers/_KTStorixVendor.h"

namespace storix::check {

namespace {

constexpr std::chrono::seconds loginTime{10};
constexpr std::chrono::seconds timeToDie{10};
/// A process that it has started may go on writing for ever.
constexpr std::size_t outputAfterTheEnd = 1024 * 1024;

const ProtocolDescription &protocol() { return _KTStorixVendorProtocol().description(); }

/// The provider's object, as somebody would describe it who has got it wrong; by `Misfit`.
const wire::InterfaceDescription &misfitInterface() {
  static const wire::InterfaceDescription description{
      protocol().interfaceName,
      protocol().objectPath,
      {{"MakeCoffee", {}, {}},
       {"IdentifierForItemAtURL", {{"URL", "s"}}, {{"error", "a(sxa{sv})"}, {"itemIdentifier", "as"}}},
       {"IdentifierForItemAtURL", {{"URL", "as"}}, {{"error", "a(sxa{sv})"}, {"itemIdentifier", "as"}}}}};
  return description;
}

ExtensionAnswer answerFrom(Arguments values) {
  ExtensionAnswer answer;
  answer.kind = ExtensionAnswer::Kind::replied;
  for (Argument &value : values) {
    if (!value) continue;
    if (const SXError *error = value->error()) answer.error = *error;
    if (const std::string *string = value->string()) answer.string = *string;
    if (const URL *url = value->url()) answer.url = *url;
  }
  return answer;
}

ExtensionAnswer refusal(std::string_view busError, std::string reason) {
  ExtensionAnswer answer;
  const bool lost = busError == "org.freedesktop.DBus.Error.Disconnected";
  answer.kind = lost ? ExtensionAnswer::Kind::lost : ExtensionAnswer::Kind::refused;
  answer.reason = std::move(reason);
  return answer;
}

int pollFor(pollfd *waited, nfds_t count, std::chrono::milliseconds time) {
  const auto deadline = std::chrono::steady_clock::now() + time;
  for (;;) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    const int ready = ::poll(waited, count, static_cast<int>(std::max<std::int64_t>(left.count(), 0)));
    if (ready >= 0 || errno != EINTR) return ready;
  }
}

}  // namespace

std::string_view operationName(Operation operation) {
  return protocol().operations[static_cast<std::size_t>(operation)].method;
}

StartedExtension::StartedExtension(std::function<void(std::string_view)> takeLine) : takeLine_(std::move(takeLine)) {}

Result<std::unique_ptr<StartedExtension>> StartedExtension::start(linuxhost::LaunchDescription description,
                                                                  std::function<void(std::string_view)> takeLine) {
  std::unique_ptr<StartedExtension> extension(new StartedExtension(std::move(takeLine)));
  std::array<int, 2> ends{};
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
    return posixError(errno, "making the connection of the extension");
  }
  UniqueFd socket(ends[0]);
  description.socket.reset(ends[1]);
  if (auto failed = extension->launch(std::move(description))) return *failed;
  if (auto failed = extension->logIn(std::move(socket))) return *failed;
  return extension;
}

std::optional<SXError> StartedExtension::launch(linuxhost::LaunchDescription description) {
  const std::string executable = description.executable;
  outputStop_.reset(::eventfd(0, EFD_CLOEXEC));
  if (!outputStop_) return posixError(errno, "making an event descriptor");
  std::promise<Result<linuxhost::LaunchedProcess>> launched;
  launcher_.launch(std::move(description),
                   [&launched](Result<linuxhost::LaunchedProcess> process) { launched.set_value(std::move(process)); });
  auto process = launched.get_future().get();
  if (!process) return process.error();
  process_ = std::move(process.value());
  outputThread_ = std::thread(&StartedExtension::readOutput, this);
  // Closed without a word once the program runs.
  pollfd waited{process_.execFailure.get(), POLLIN, 0};
  pollFor(&waited, 1, loginTime);
  int error = 0;
  if (::read(process_.execFailure.get(), &error, sizeof error) == sizeof error) {
    return posixError(error, "running the program " + executable);
  }
  return std::nullopt;
}

std::optional<SXError> StartedExtension::logIn(UniqueFd socket) {
  wire::BusConnection::Options options;
  options.side = wire::BusConnection::Side::server;
  options.peer = "the extension";
  const auto over = [this](std::optional<SXError> error) {
    std::call_once(loginOver_, [this, &error] { login_.set_value(std::move(error)); });
  };
  auto added = loop_.add(std::move(socket), std::move(options), [over](wire::BusConnection &connection) {
    connection.setReadyHandler([over] { over(std::nullopt); });
    connection.setClosedHandler([over](const SXError &error) { over(error); });
  });
  std::optional<SXError> failed;
  if (added) {
    connection_ = added.value();
    loopThread_ = std::thread([this] { loop_.run(); });
    auto login = login_.get_future();
    if (login.wait_for(loginTime) != std::future_status::ready) {
      return posixError(ETIMEDOUT, "waiting for the login of the extension's process");
    }
    failed = login.get();
  } else {
    failed = added.error();
  }
  if (!failed) return std::nullopt;
  if (const auto end = waitForEnd(std::chrono::seconds(1))) {
    return linuxhost::hostError(linuxhost::HostErrorCode::extensionExited,
                                "The process " + *end + " before it had logged in.");
  }
  return linuxhost::hostError(
      linuxhost::HostErrorCode::connectionClosed,
      "The login failed: the process closed its connection or sent nonsense (" + failed->message() + ").");
}

StartedExtension::~StartedExtension() {
  if (connection_) connection_->close();
  loop_.stop();
  if (loopThread_.joinable()) loopThread_.join();
  kill();
  if (outputThread_.joinable()) {
    ::eventfd_write(outputStop_.get(), 1);
    outputThread_.join();
  }
}

void StartedExtension::kill() {
  if (!process_.pidfd || ending_) return;
  ::syscall(SYS_pidfd_send_signal, process_.pidfd.get(), SIGKILL, nullptr, 0);
  waitForEnd(timeToDie);
}

/// Until the output ends, or the process has and with it what was still to be read.
void StartedExtension::readOutput() {
  linuxhost::OutputLines lines(takeLine_);
  std::array<char, 4096> buffer{};
  std::array<pollfd, 2> waited{{{process_.output.get(), POLLIN, 0}, {outputStop_.get(), POLLIN, 0}}};
  std::size_t afterTheEnd = 0;
  while (afterTheEnd < outputAfterTheEnd) {
    if (::poll(waited.data(), waited.size(), -1) < 0) continue;
    const bool processHasEnded = waited[1].revents != 0;
    const ssize_t size = ::read(process_.output.get(), buffer.data(), buffer.size());
    if (size > 0) {
      lines.append(std::string_view(buffer.data(), static_cast<std::size_t>(size)));
      if (processHasEnded) afterTheEnd += static_cast<std::size_t>(size);
    } else if (size == 0 || processHasEnded) {
      break;
    }
  }
  lines.finish();
}

StartedExtension::Pending StartedExtension::send(Operation operation, Argument argument) {
  auto promise = std::make_shared<std::promise<ExtensionAnswer>>();
  const auto remote = connection_->remoteObject(LinkInterface(protocol()), [promise](const SXError &error) {
    promise->set_value(refusal(error.stringDetail("busError").value_or(""), error.message()));
  });
  Arguments arguments;
  if (operation != Operation::performInitialSetup) arguments.push_back(std::move(argument));
  Pending pending = promise->get_future();
  remote->send(static_cast<std::size_t>(operation), std::move(arguments),
               [promise](Arguments values) { promise->set_value(answerFrom(std::move(values))); });
  return pending;
}

StartedExtension::Pending StartedExtension::sendMisfit(Misfit misfit) {
  auto promise = std::make_shared<std::promise<ExtensionAnswer>>();
  Pending pending = promise->get_future();
  wire::MethodValues values;
  if (misfit == Misfit::type) values.emplace_back(std::string("file:///"));
  if (misfit == Misfit::url) values.emplace_back(std::optional<std::string>("no URL"));
  connection_->call(misfitInterface(), static_cast<std::size_t>(misfit), std::move(values),
                    [promise](wire::MethodResult result) {
                      if (const auto *failure = std::get_if<wire::MethodFailure>(&result)) {
                        return promise->set_value(refusal(failure->name, failure->text));
                      }
                      ExtensionAnswer answer;
                      answer.kind = ExtensionAnswer::Kind::replied;
                      for (const auto &value : std::get<wire::MethodValues>(result)) {
                        if (const auto *error = std::get_if<std::optional<SXError>>(&value)) answer.error = *error;
                      }
                      promise->set_value(std::move(answer));
                    });
  return pending;
}

ExtensionAnswer StartedExtension::wait(Pending &pending, std::chrono::milliseconds time) {
  if (pending.wait_for(time) == std::future_status::ready) return pending.get();
  return {};
}

std::size_t StartedExtension::countDescriptors() const {
  std::error_code failed;
  const std::filesystem::directory_iterator entries("/proc/" + std::to_string(process_.processIdentifier) + "/fd",
                                                    failed);
  return failed ? 0 : static_cast<std::size_t>(std::distance(begin(entries), end(entries)));
}

void StartedExtension::closeConnection() { connection_->close(); }

std::optional<std::string> StartedExtension::waitForEnd(std::chrono::milliseconds time) {
  if (ending_) return ending_;
  pollfd waited{process_.pidfd.get(), POLLIN, 0};
  if (pollFor(&waited, 1, time) <= 0) return std::nullopt;
  siginfo_t information{};
  if (::waitid(P_PIDFD, static_cast<id_t>(process_.pidfd.get()), &information, WEXITED) != 0) return std::nullopt;
  if (information.si_code == CLD_EXITED) {
    endedWell_ = information.si_status == 0;
    ending_ = "exited with status " + std::to_string(information.si_status);
  } else {
    const char *description = ::sigdescr_np(information.si_status);
    ending_ = "was killed by signal " + std::to_string(information.si_status) +
              (description ? " (" + std::string(description) + ")" : std::string());
  }
  return ending_;
}

}  // namespace storix::check
