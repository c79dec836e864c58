#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/SteppedTime.h"
#include "platform/linux/TestDirectory.h"
#include "platform/linux/extensions/ExtensionHost.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

using namespace std::chrono_literals;

inline const ProtocolDescription vendorProtocol{
    "_KTStorixVendor",
    "com.tessel.StorixVendor",
    "/com/tessel/StorixVendor",
    {{"_identifierForItemAtURL:completion:",
      "IdentifierForItemAtURL",
      {{"URL", ValueKind::URL}},
      {{"error", ValueKind::error}, {"itemIdentifier", ValueKind::string}}}}};

using Record = std::shared_ptr<ExtensionRecord>;

struct Begun {
  std::optional<RequestIdentifier> request;
  std::optional<SXError> error;
};

/// What became of one message.
struct Answer {
  std::optional<std::string> text;
  /// What the error handler got.
  std::optional<SXError> failure;
};

/// A result that a handler gives later, and how often it has been given.
template <class T>
class Later {
 public:
  void give(T value) {
    if (state_->count.fetch_add(1) == 0) state_->promise.set_value(std::move(value));
  }
  T wait() {
    if (state_->future.wait_for(60s) != std::future_status::ready) {
      ADD_FAILURE() << "nothing came";
      return {};
    }
    return state_->future.get();
  }
  [[nodiscard]] int count() const { return state_->count; }

 private:
  struct State {
    std::promise<T> promise;
    std::future<T> future = promise.get_future();
    std::atomic<int> count{0};
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

inline bool isCode(const std::optional<SXError> &error, HostErrorCode code) {
  return error && error->domain() == platformErrorDomain && error->code() == static_cast<std::int64_t>(code);
}

/// A process that the test watches, though the host is its parent.
class Watched {
 public:
  explicit Watched(pid_t process) : pidfd_(static_cast<int>(::syscall(SYS_pidfd_open, process, 0))) {
    EXPECT_TRUE(pidfd_) << process;
  }
  [[nodiscard]] bool isRunning() const { return !hasExited(0); }
  [[nodiscard]] bool waitForExit() const { return hasExited(60'000); }
  /// Sends a signal that the process handles until it has gone: ThreadSanitizer keeps one that comes just
  /// before the process goes to sleep from its handler until another one wakes it.
  void endWith(int signal) const {
    for (int i = 0; i < 600; ++i) {
      ::syscall(SYS_pidfd_send_signal, pidfd_.get(), signal, nullptr, 0);
      if (hasExited(100)) return;
    }
    ADD_FAILURE() << "signal " << signal << " did not end the process";
  }

 private:
  [[nodiscard]] bool hasExited(int milliseconds) const {
    pollfd waiting{pidfd_.get(), POLLIN, 0};
    return ::poll(&waiting, 1, milliseconds) == 1;
  }
  UniqueFd pidfd_;
};

/// A host over a directory of its own, with real processes and a time that the test moves.
class ExtensionHostTest : public ::testing::Test {
 protected:
  ExtensionHostTest() { makeHost(true); }
  ~ExtensionHostTest() override {
    // What still runs asks for the time, and watches.
    host_.reset();
    loop_.end();
    pool_.end();
  }
  ExtensionHostTest(const ExtensionHostTest &) = delete;
  ExtensionHostTest &operator=(const ExtensionHostTest &) = delete;

  void makeHost(bool withContextClass, std::unique_ptr<ExtensionConfinement> confinement = nullptr) {
    host_.reset();
    host_ = std::make_unique<ExtensionHost>(
        ExtensionPlaces{{directory_ / "extensions"}, directory_ / "groups"},
        std::vector<std::string>{"HOME=/home/u", "PATH=/bin", "STORIX_RUNTIME_DIR=/run/x"}, time_, loop_,
        std::move(confinement));
    if (!withContextClass) return;
    host_->registerExtensionContextClass("_KTStorixExtensionHostContext",
                                         {[]() -> const LinkInterface & { return vendorInterface(); },
                                          []() -> const LinkInterface & { return vendorInterface(); },
                                          [](std::shared_ptr<AuxiliaryConnection> connection) {
                                            return std::make_shared<ExtensionContext>(std::move(connection));
                                          }});
  }

  static const LinkInterface &vendorInterface() {
    static const LinkInterface interface(vendorProtocol);
    return interface;
  }

  /// Installs the test's extension, which behaves as its executable is called.
  std::string install(const std::string &behaviour, const std::string &more = {}) {
    const std::string bundle = "extensions/" + behaviour + ".appdex";
    directory_.makeFile(bundle + "/Info.kvs",
                        R"({"KTBundleIdentifier": "org.)" + behaviour +
                            R"(", "KTExtensionPointIdentifier": "point", "KTBundleExecutable": ")" + behaviour + "\"" +
                            more + "}");
    if (!std::filesystem::exists(directory_ / (bundle + "/" + behaviour))) {
      std::filesystem::copy_file(STORIX_TEST_EXTENSION, directory_ / (bundle + "/" + behaviour));
    }
    return directory_ / bundle;
  }

  /// The record of the one extension that is installed.
  Record record() {
    Later<std::vector<Record>> found;
    const auto matching =
        host_->beginMatchingExtensions({{std::string(extensionPointAttribute), "point"}},
                                       [found](std::vector<Record> records, const std::optional<SXError> &) mutable {
                                         found.give(std::move(records));
                                       });
    const std::vector<Record> records = found.wait();
    EXPECT_EQ(records.size(), 1U);
    return records.empty() ? nullptr : records.front();
  }

  Record installedRecord(const std::string &behaviour, const std::string &more = {}) {
    install(behaviour, more);
    return record();
  }

  static Later<Begun> beginLater(const Record &record) {
    Later<Begun> begun;
    const auto inside = std::make_shared<std::atomic<bool>>(true);
    record->beginExtensionRequest(
        [begun, inside, thread = std::this_thread::get_id()](const auto &request, const auto &error) mutable {
          EXPECT_FALSE(*inside && thread == std::this_thread::get_id()) << "the handler ran inside the call";
          begun.give({request, error});
        });
    *inside = false;
    return begun;
  }

  static Begun begin(const Record &record) { return beginLater(record).wait(); }

  static RequestIdentifier beginWell(const Record &record) {
    const Begun begun = begin(record);
    EXPECT_FALSE(begun.error) << begun.error->message();
    EXPECT_TRUE(begun.request);
    return begun.request.value_or(RequestIdentifier{});
  }

  static Later<Answer> askLater(const Record &record, const RequestIdentifier &request, const std::string &what) {
    Later<Answer> answer;
    const std::shared_ptr<ExtensionContext> context = record->extensionContextForRequest(request);
    if (!context) {
      ADD_FAILURE() << "no context";
      return answer;
    }
    const std::shared_ptr<RemoteObject> proxy =
        context->auxiliaryConnection()->remoteProxyWithErrorHandler([answer](SXError error) mutable {
          answer.give({std::nullopt, std::move(error)});
        });
    proxy->send(0, {Value(*URL::fileURLWithPath("/" + what))}, [answer](const Arguments &values) mutable {
      answer.give({values.at(1) ? std::optional(*values.at(1)->string()) : std::nullopt, std::nullopt});
    });
    return answer;
  }

  static Answer ask(const Record &record, const RequestIdentifier &request, const std::string &what) {
    return askLater(record, request, what).wait();
  }

  static std::string textFor(const Record &record, const RequestIdentifier &request, const std::string &what) {
    const Answer answer = ask(record, request, what);
    EXPECT_FALSE(answer.failure) << answer.failure->message();
    return answer.text.value_or("");
  }

  static pid_t processOf(const Record &record, const RequestIdentifier &request) {
    return static_cast<pid_t>(std::stol("0" + textFor(record, request, "pid")));
  }

  static std::optional<SXError> failureOf(const Record &record) { return begin(record).error; }

  /// The first line of the log that holds the text, once it is there; else none.
  std::string waitForLine(std::string_view text) {
    const auto deadline = std::chrono::steady_clock::now() + 60s;
    while (std::chrono::steady_clock::now() < deadline) {
      for (const std::string &line : platform_->log().texts()) {
        if (line.find(text) != std::string::npos) return line;
      }
      std::this_thread::yield();
    }
    ADD_FAILURE() << "no line with: " << text;
    return {};
  }

  /// The process of the extension that was started, as the log tells.
  pid_t startedProcess() {
    const std::string beginning = "[INFO] Started process ";
    const std::string line = waitForLine(beginning);
    return line.empty() ? 0 : static_cast<pid_t>(std::stol(line.substr(beginning.size())));
  }

  /// Ends the last request of an idle process that goes on: its connection is closed after ten seconds,
  /// and five seconds later the first signal ends it.
  void expectEndByTheFirstSignal(const Record &extension, const RequestIdentifier &request, const Watched &process) {
    extension->cancelExtensionRequest(request);
    time_.advance(std::chrono::seconds(10));
    ASSERT_TRUE(time_.waitForTaskIn(std::chrono::seconds(5)));
    EXPECT_TRUE(process.isRunning());
    time_.advance(std::chrono::seconds(5));
    EXPECT_TRUE(process.waitForExit());
  }
  /// The same of one that the first signal does not end: five seconds later the second one does.
  void expectEndByTheSecondSignal(const Record &extension, const RequestIdentifier &request, const Watched &process) {
    extension->cancelExtensionRequest(request);
    time_.advance(std::chrono::seconds(10));
    ASSERT_TRUE(time_.waitForTaskIn(std::chrono::seconds(10)));
    time_.advance(std::chrono::seconds(5));
    EXPECT_TRUE(process.isRunning());
    time_.advance(std::chrono::seconds(5));
    EXPECT_TRUE(process.waitForExit());
  }

  static void waitUntilReaped(pid_t process) {
    const auto deadline = std::chrono::steady_clock::now() + 60s;
    while (::kill(process, 0) == 0 && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    EXPECT_EQ(::kill(process, 0), -1);
  }

  static bool hasChildren() {
    siginfo_t information{};
    return ::waitid(P_ALL, 0, &information, WEXITED | WNOHANG | WNOWAIT) == 0;
  }

  TestDirectory directory_;
  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
  ProcessScope scope_{*platform_};
  ThreadPool pool_;
  SteppedTime time_{pool_};
  IoLoop loop_{pool_};
  std::unique_ptr<ExtensionHost> host_;
};

}  // namespace storix::linuxhost
