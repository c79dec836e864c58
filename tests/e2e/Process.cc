#include "tests/e2e/Process.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <cstring>

namespace storix::e2e {

namespace {

struct Pipe {
  UniqueFd reading;
  UniqueFd writing;
};

Pipe makePipe() {
  int ends[2] = {-1, -1};
  EXPECT_EQ(0, ::pipe2(ends, O_CLOEXEC)) << std::strerror(errno);
  EXPECT_EQ(0, ::fcntl(ends[0], F_SETFL, O_NONBLOCK)) << std::strerror(errno);
  return {UniqueFd(ends[0]), UniqueFd(ends[1])};
}

std::vector<char *> pointers(std::vector<std::string> &strings) {
  std::vector<char *> result;
  result.reserve(strings.size() + 1);
  for (std::string &string : strings) result.push_back(string.data());
  result.push_back(nullptr);
  return result;
}

std::string joined(const std::vector<std::string> &lines) {
  std::string text;
  for (const std::string &line : lines) text += line + '\n';
  return text;
}

}  // namespace

Process::Process(std::vector<std::string> arguments, const Environment &environment) {
  Pipe output = makePipe();
  Pipe errors = makePipe();
  std::vector<std::string> variables;
  variables.reserve(environment.size());
  for (const auto &[name, value] : environment) variables.push_back(name + "=" + value);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, output.writing.get(), 1);
  posix_spawn_file_actions_adddup2(&actions, errors.writing.get(), 2);
  const int error = ::posix_spawnp(&processIdentifier_, arguments[0].c_str(), &actions, nullptr,
                                   pointers(arguments).data(), pointers(variables).data());
  posix_spawn_file_actions_destroy(&actions);
  if (error != 0) {
    processIdentifier_ = -1;
    status_ = 127;
    ADD_FAILURE() << "cannot start " << arguments[0] << ": " << std::strerror(error);
    return;
  }
  pidfd_.reset(static_cast<int>(::syscall(SYS_pidfd_open, processIdentifier_, 0)));
  output_.pipe = std::move(output.reading);
  errors_.pipe = std::move(errors.reading);
  output_.open = errors_.open = true;
  outputReader_ = std::thread([this] { collect(output_); });
  errorReader_ = std::thread([this] { collect(errors_); });
}

Process::~Process() {
  if (!hasEnded()) {
    signal(SIGKILL);
    wait();
  }
  if (outputReader_.joinable()) outputReader_.join();
  if (errorReader_.joinable()) errorReader_.join();
}

void Process::collect(Printed &printed) {
  for (;;) {
    pollfd waited{printed.pipe.get(), POLLIN, 0};
    ::poll(&waited, 1, -1);
    const std::lock_guard lock(mutex_);
    take(printed);
    changed_.notify_all();
    if (!printed.open) return;
  }
}

/// With the mutex held: all that the program has printed by now.
void Process::take(Printed &printed) {
  char buffer[4096];
  while (printed.open) {
    const ssize_t count = ::read(printed.pipe.get(), buffer, sizeof buffer);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0 && errno == EAGAIN) return;
    std::string &pending = printed.pending;
    if (count <= 0) {
      if (!pending.empty()) printed.lines.push_back(std::move(pending));
      printed.open = false;
      return;
    }
    pending.append(buffer, static_cast<std::size_t>(count));
    for (std::size_t end = pending.find('\n'); end != std::string::npos; end = pending.find('\n')) {
      printed.lines.push_back(pending.substr(0, end));
      pending.erase(0, end + 1);
    }
  }
}

void Process::signal(int number) const {
  if (pidfd_) ::syscall(SYS_pidfd_send_signal, pidfd_.get(), number, nullptr, 0);
}

bool Process::hasEnded() {
  reap();
  return status_.has_value();
}

void Process::reap() {
  if (status_) return;
  int status = 0;
  if (::waitpid(processIdentifier_, &status, WNOHANG) != processIdentifier_) return;
  status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

int Process::wait() {
  if (!hasEnded()) {
    pollfd ended{pidfd_.get(), POLLIN, 0};
    const int milliseconds = static_cast<int>(std::chrono::milliseconds(deadline).count());
    if (::poll(&ended, 1, milliseconds) != 1) {
      ADD_FAILURE() << "the program did not end; its last words:\n" << joined(errorLines());
      signal(SIGKILL);
      ::poll(&ended, 1, milliseconds);
    }
    reap();
  }
  std::unique_lock lock(mutex_);
  changed_.wait_for(lock, deadline, [this] { return !output_.open && !errors_.open; });
  return status_.value_or(-1);
}

std::optional<std::size_t> Process::waitForLine(const std::string &text, std::size_t from) {
  std::unique_lock lock(mutex_);
  std::size_t next = from;
  const auto found = [&] {
    for (; next < errors_.lines.size(); ++next) {
      if (errors_.lines[next].find(text) != std::string::npos) return true;
    }
    return false;
  };
  if (changed_.wait_for(lock, deadline, [&] { return found() || (!output_.open && !errors_.open); }) &&
      next < errors_.lines.size()) {
    return next;
  }
  ADD_FAILURE() << "no line with “" << text << "” among:\n" << joined(errors_.lines);
  return std::nullopt;
}

std::vector<std::string> Process::errorLines() {
  const std::lock_guard lock(mutex_);
  take(errors_);
  return errors_.lines;
}

std::string Process::output() {
  const std::lock_guard lock(mutex_);
  take(output_);
  return joined(output_.lines);
}

std::size_t Process::countLines(const std::string &text) {
  std::size_t count = 0;
  for (const std::string &line : errorLines()) count += line.find(text) != std::string::npos ? 1 : 0;
  return count;
}

Finished run(std::vector<std::string> arguments, const Process::Environment &environment) {
  Process process(std::move(arguments), environment);
  const int status = process.wait();
  return {status, process.output(), joined(process.errorLines())};
}

}  // namespace storix::e2e
