#include "platform/linux/extensions/ExtensionLauncher.h"

#include <fcntl.h>
#include <linux/close_range.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <future>
#include <memory>
#include <utility>

namespace storix::linuxhost {

namespace {

constexpr int firstNumberAfterSocket = launchedSocketNumber + 1;

/// All that the child needs, made before the fork: between fork and exec nothing may allocate.
struct ChildPlan {
  const char *executable;
  const char *workingDirectory;
  char *const *arguments;
  char *const *environment;
  int input;
  int output;
  int socket;
  /// They become `firstNumberAfterSocket` and so on.
  const int *descriptors;
  int descriptorCount;
  int failure;
  pid_t parent;
};

[[noreturn]] void giveUp(int failure) {
  const int error = errno;
  // The parent takes a short write, or none, for a failure without a reason.
  [[maybe_unused]] const ssize_t written = ::write(failure, &error, sizeof(error));
  ::_exit(127);
}

/// Runs in the child, which is a copy of one thread of many: async-signal-safe calls alone.
[[noreturn]] void becomeChild(const ChildPlan &plan) {
  if (::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0) giveUp(plan.failure);
  if (::getppid() != plan.parent) ::_exit(127);  // the daemon ended meanwhile
  if (::setsid() < 0) giveUp(plan.failure);      // the terminal's signals are for the daemon
  if (::dup2(plan.input, STDIN_FILENO) < 0 || ::dup2(plan.output, STDOUT_FILENO) < 0 ||
      ::dup2(plan.output, STDERR_FILENO) < 0 || ::dup2(plan.socket, launchedSocketNumber) < 0) {
    giveUp(plan.failure);
  }
  for (int i = 0; i < plan.descriptorCount; ++i) {
    if (::dup2(plan.descriptors[i], firstNumberAfterSocket + i) < 0) giveUp(plan.failure);
  }
  if (::syscall(SYS_close_range, firstNumberAfterSocket + plan.descriptorCount, ~0U, CLOSE_RANGE_CLOEXEC) != 0) {
    giveUp(plan.failure);
  }
  if (::chdir(plan.workingDirectory) != 0) giveUp(plan.failure);
  struct sigaction action = {};
  action.sa_handler = SIG_DFL;
  for (int number = 1; number < NSIG; ++number) {
    ::sigaction(number, &action, nullptr);  // refused for SIGKILL, SIGSTOP and those of the C library
  }
  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  ::execve(plan.executable, plan.arguments, plan.environment);
  giveUp(plan.failure);
}

struct Pipe {
  UniqueFd reading;
  UniqueFd writing;
};

Result<Pipe> makePipe() {
  std::array<int, 2> ends{};
  if (::pipe2(ends.data(), O_CLOEXEC) != 0) return posixError(errno, "making a pipe for an extension");
  Pipe made{UniqueFd(ends[0]), UniqueFd(ends[1])};
  if (::fcntl(made.reading.get(), F_SETFL, O_NONBLOCK) != 0) return posixError(errno, "setting up a pipe");
  return made;
}

/// The same, under a number that does not stand in the way of those that the child is to have.
Result<UniqueFd> moved(UniqueFd fd, int firstFreeNumber) {
  if (fd.get() >= firstFreeNumber) return fd;
  UniqueFd copy(::fcntl(fd.get(), F_DUPFD_CLOEXEC, firstFreeNumber));
  if (!copy) return posixError(errno, "preparing an extension's descriptors");
  return copy;
}

}  // namespace

Result<LaunchedProcess> launchProcess(LaunchDescription description) {
  Result<Pipe> output = makePipe();
  if (!output) return output.error();
  Result<Pipe> failure = makePipe();
  if (!failure) return failure.error();
  const int firstFreeNumber = firstNumberAfterSocket + static_cast<int>(description.descriptors.size());
  Result<UniqueFd> childOutput = moved(std::move(output.value().writing), firstFreeNumber);
  Result<UniqueFd> childFailure = moved(std::move(failure.value().writing), firstFreeNumber);
  Result<UniqueFd> childSocket = moved(std::move(description.socket), firstFreeNumber);
  UniqueFd null(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  if (!null) return posixError(errno, "opening /dev/null");
  Result<UniqueFd> childInput = moved(std::move(null), firstFreeNumber);
  for (const auto *descriptor : {&childOutput, &childFailure, &childSocket, &childInput}) {
    if (!descriptor->ok()) return descriptor->error();
  }
  std::vector<int> childDescriptors;
  for (UniqueFd &descriptor : description.descriptors) {
    Result<UniqueFd> placed = moved(std::move(descriptor), firstFreeNumber);
    if (!placed) return placed.error();
    descriptor = std::move(placed.value());
    childDescriptors.push_back(descriptor.get());
  }

  description.environment.push_back("STORIX_EXTENSION_FD=" + std::to_string(launchedSocketNumber));
  std::vector<char *> environment;
  environment.reserve(description.environment.size() + 1);
  for (std::string &variable : description.environment) environment.push_back(variable.data());
  environment.push_back(nullptr);
  std::vector<char *> arguments = {description.executable.data()};
  for (std::string &argument : description.arguments) arguments.push_back(argument.data());
  arguments.push_back(nullptr);

  const ChildPlan plan{description.executable.c_str(),
                       description.workingDirectory.c_str(),
                       arguments.data(),
                       environment.data(),
                       childInput.value().get(),
                       childOutput.value().get(),
                       childSocket.value().get(),
                       childDescriptors.data(),
                       static_cast<int>(childDescriptors.size()),
                       childFailure.value().get(),
                       ::getpid()};

  // No handler of the daemon's may run in the child.
  sigset_t all;
  sigset_t before;
  ::sigfillset(&all);
  ::pthread_sigmask(SIG_SETMASK, &all, &before);
  const pid_t child = ::fork();
  const int forkError = errno;
  if (child == 0) becomeChild(plan);
  ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (child < 0) return posixError(forkError, "starting a process for " + description.executable);

  LaunchedProcess process;
  process.processIdentifier = child;
  process.pidfd.reset(static_cast<int>(::syscall(SYS_pidfd_open, child, 0)));
  if (!process.pidfd) {
    const int error = errno;
    ::kill(child, SIGKILL);
    while (::waitpid(child, nullptr, 0) < 0 && errno == EINTR) {
    }
    return posixError(error, "watching the process for " + description.executable);
  }
  process.output = std::move(output.value().reading);
  process.execFailure = std::move(failure.value().reading);
  process.isConfined = description.isConfined;
  return process;
}

ExtensionLauncher::ExtensionLauncher() : thread_(&ExtensionLauncher::run, this) {}

ExtensionLauncher::~ExtensionLauncher() {
  {
    const std::lock_guard lock(mutex_);
    ending_ = true;
  }
  changed_.notify_one();
  thread_.join();
}

void ExtensionLauncher::launch(LaunchDescription description, Handler handler) {
  auto work = [description = std::make_shared<LaunchDescription>(std::move(description)),
               handler = std::move(handler)] {
    if (const auto prepare = std::exchange(description->prepare, nullptr)) {
      if (const std::optional<SXError> error = prepare(*description)) {
        handler(*error);
        return;
      }
    }
    handler(launchProcess(std::move(*description)));
  };
  {
    const std::lock_guard lock(mutex_);
    work_.push_back(std::move(work));
  }
  changed_.notify_one();
}

void ExtensionLauncher::waitUntilIdle() {
  std::promise<void> reached;
  {
    const std::lock_guard lock(mutex_);
    work_.emplace_back([&reached] { reached.set_value(); });
  }
  changed_.notify_one();
  reached.get_future().wait();
}

void ExtensionLauncher::run() {
  std::unique_lock lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this] { return ending_ || !work_.empty(); });
    if (work_.empty()) return;
    std::function<void()> work = std::move(work_.front());
    work_.pop_front();
    lock.unlock();
    work();
    work = nullptr;
    lock.lock();
  }
}

}  // namespace storix::linuxhost
