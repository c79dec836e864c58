#include "platform/linux/extensions/ExtensionConfinement.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <climits>
#include <csignal>
#include <fstream>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/files/PathText.h"
#include "platform/linux/files/ResolvedPath.h"

namespace storix::linuxhost {

namespace {

constexpr std::chrono::seconds trialTime{10};
constexpr int firstDescriptor = launchedSocketNumber + 1;

using Words = std::vector<std::string>;

void append(Words &words, std::initializer_list<std::string_view> more) {
  words.insert(words.end(), more.begin(), more.end());
}

/// The system's programs and libraries, whether or not /bin and its like lead into /usr.
void appendSystem(Words &words) {
  append(words, {"--ro-bind", "/usr", "/usr"});
  for (const char *name : {"/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"}) {
    std::array<char, PATH_MAX> target{};
    const ssize_t length = ::readlink(name, target.data(), target.size());
    if (length > 0) {
      append(words, {"--symlink", std::string_view(target.data(), static_cast<std::size_t>(length)), name});
    } else {
      append(words, {"--ro-bind-try", name, name});
    }
  }
  for (const char *name : {"/etc/ld.so.cache", "/etc/alternatives", "/etc/localtime", "/etc/timezone"}) {
    append(words, {"--ro-bind-try", name, name});
  }
}

/// Names of hosts, and whom to trust that answers to one.
void appendNetwork(Words &words) {
  for (const char *name : {"/etc/resolv.conf", "/etc/hosts", "/etc/host.conf", "/etc/gai.conf", "/etc/nsswitch.conf",
                           "/etc/services", "/etc/protocols", "/etc/ssl", "/etc/ca-certificates", "/etc/pki"}) {
    append(words, {"--ro-bind-try", name, name});
  }
}

Words basicArguments(bool network) {
  Words words;
  append(words, {"--unshare-user", "--unshare-ipc", "--unshare-pid", "--unshare-uts", "--unshare-cgroup"});
  if (!network) append(words, {"--unshare-net"});
  append(words, {"--die-with-parent", "--new-session", "--cap-drop", "ALL"});
  appendSystem(words);
  if (network) appendNetwork(words);
  append(words, {"--proc", "/proc", "--dev", "/dev", "--tmpfs", "/tmp"});
  return words;
}

void appendBind(Words &words, LaunchDescription &description, UniqueFd fd, bool writable, const std::string &where) {
  const std::string number = std::to_string(firstDescriptor + static_cast<int>(description.descriptors.size()));
  append(words, {writable ? "--bind-fd" : "--ro-bind-fd", number, where});
  description.descriptors.push_back(std::move(fd));
}

/// From here on the directories that only lead to what is bound cannot be written.
void appendProgram(Words &words, const std::string &directory, const std::string &program) {
  append(words, {"--remount-ro", "/", "--chdir", directory, "--", program});
}

/// What the trial has printed, on one line.
std::string wordsOf(int output) {
  std::array<char, 1024> buffer{};
  const ssize_t size = ::read(output, buffer.data(), buffer.size());
  std::string text(buffer.data(), size < 0 ? 0 : static_cast<std::size_t>(size));
  while (text.ends_with('\n')) text.pop_back();
  return text;
}

std::vector<pid_t> childrenOf(pid_t process) {
  const std::string number = std::to_string(process);
  std::ifstream file("/proc/" + number + "/task/" + number + "/children");
  std::vector<pid_t> children;
  for (pid_t child = 0; file >> child;) children.push_back(child);
  return children;
}

/// Bubblewrap's process has one child, the first process of the sandbox, which starts the program and
/// takes on whom its parent has left.
std::vector<pid_t> confinedProcesses(pid_t process) {
  const std::vector<pid_t> first = childrenOf(process);
  return first.empty() ? first : childrenOf(first.front());
}

/// Signals those that are found below that process. False when there was none.
bool signalAll(std::vector<pid_t> (*find)(pid_t), pid_t process, int signal) {
  bool isSent = false;
  for (const pid_t found : find(process)) {
    const UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, found, 0)));
    // Whoever has got the number meanwhile is in the sandbox too, or is left alone.
    const std::vector<pid_t> now = find(process);
    if (!pidfd || std::find(now.begin(), now.end(), found) == now.end()) continue;
    if (::syscall(SYS_pidfd_send_signal, pidfd.get(), signal, nullptr, 0) == 0) isSent = true;
  }
  return isSent;
}

/// Empty when the process ended well, else what is wrong. An error when nothing can be said.
Result<std::string> outcomeOf(const LaunchedProcess &process, const std::string &program) {
  pollfd exit{process.pidfd.get(), POLLIN, 0};
  const auto deadline = std::chrono::steady_clock::now() + trialTime;
  int ready = -1;
  do {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    ready = ::poll(&exit, 1, static_cast<int>(std::max(left.count(), std::int64_t{0})));
  } while (ready < 0 && errno == EINTR);
  if (ready != 1) ::syscall(SYS_pidfd_send_signal, process.pidfd.get(), SIGKILL, nullptr, 0);
  siginfo_t information{};
  while (::waitid(P_PIDFD, static_cast<id_t>(process.pidfd.get()), &information, WEXITED) != 0) {
    if (errno != EINTR) return posixError(errno, "trying " + program);
  }
  if (ready != 1) return program + " did not end within 10 seconds";
  int error = 0;
  if (::read(process.execFailure.get(), &error, sizeof error) == sizeof error) {
    if (error == ENOENT) return program + " is not there";
    return posixError(error, "running " + program).message();
  }
  if (information.si_code == CLD_EXITED && information.si_status == 0) return std::string();
  const std::string words = wordsOf(process.output.get());
  return program + " does not work here" + (words.empty() ? std::string() : " (" + words + ")");
}

}  // namespace

bool signalConfined(pid_t process, int signal) { return signalAll(confinedProcesses, process, signal); }

void killConfined(pid_t process) {
  // Its first process leaves bubblewrap's group before it is bound to bubblewrap's life, but not before it is
  // to be seen.
  (void)signalAll(childrenOf, process, SIGKILL);
  ::kill(-process, SIGKILL);
}

struct ExtensionConfinement::Grant {
  std::string where;
  bool writable = false;
  UniqueFd fd;
};

ExtensionConfinement::ExtensionConfinement(ConfinementPlaces places, ConfinementPolicy policy, std::string program)
    : places_(std::move(places)), policy_(policy), program_(std::move(program)) {}

std::optional<SXError> ExtensionConfinement::confine(LaunchDescription &description, const ExtensionBundle &bundle) {
  if (!works_) {
    if (std::optional<SXError> error = settleWhetherItWorks()) return error;
  }
  if (refusal_) return refusal_;
  if (!*works_) return std::nullopt;
  if (std::optional<SXError> error = checkProgram(description, bundle)) return error;

  Words words = basicArguments(bundle.wishes.network);
  // It is there, and empty, for programs that insist on one.
  append(words, {"--dir", places_.homeDirectory});
  for (Grant &grant : grantsOf(bundle)) {
    appendBind(words, description, std::move(grant.fd), grant.writable, grant.where);
  }
  UniqueFd directory(::open(bundle.path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory) return posixError(errno, "opening the bundle " + quotedPath(bundle.path));
  appendBind(words, description, std::move(directory), false, bundle.path);
  // They may have been removed since the bundle was found.
  const std::vector<BundleProblem> problems = makeGroupContainers(places_.extensions, bundle);
  if (!problems.empty()) return problems.front().error;
  for (const std::string &group : bundle.groups) {
    const std::string path = groupContainerPath(places_.extensions, group);
    UniqueFd container(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!container) return posixError(errno, "opening the group container " + quotedPath(path));
    appendBind(words, description, std::move(container), true, path);
  }
  appendProgram(words, bundle.path, description.executable);
  description.executable = program_;
  description.arguments = std::move(words);
  description.workingDirectory = "/";
  description.isConfined = true;
  return std::nullopt;
}

/// With an error nothing is settled, and the next call tries again.
std::optional<SXError> ExtensionConfinement::settleWhetherItWorks() {
  std::string reason = "STORIX_CONFINEMENT is “off”";
  if (policy_ != ConfinementPolicy::off) {
    // As an extension is confined, with bubblewrap itself for the program.
    LaunchDescription trial;
    trial.executable = program_;
    trial.workingDirectory = "/";
    trial.socket.reset(::open("/dev/null", O_RDWR | O_CLOEXEC));
    UniqueFd system(::open("/usr", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!trial.socket || !system) return posixError(errno, "trying " + program_);
    Words words = basicArguments(false);
    appendBind(words, trial, std::move(system), false, "/tmp/trial");
    appendProgram(words, "/", program_);
    trial.arguments = std::move(words);
    trial.arguments.emplace_back("--version");
    const Result<LaunchedProcess> process = launchProcess(std::move(trial));
    if (!process) return process.error();
    Result<std::string> outcome = outcomeOf(process.value(), program_);
    if (!outcome) return outcome.error();
    reason = outcome.value();
  }
  works_ = reason.empty();
  if (*works_) return std::nullopt;
  const std::string advice = policy_ == ConfinementPolicy::off
                                 ? "Unset it to confine them."
                                 : "Install bubblewrap (0.8.0 with --bind-fd, or 0.10 or later) and permit user "
                                   "namespaces to confine them.";
  if (policy_ == ConfinementPolicy::required) {
    refusal_ =
        hostError(HostErrorCode::cannotConfine,
                  "Extensions are not started, since STORIX_CONFINEMENT is “required” and " + reason + ". " + advice);
    sx_default_log().fault("[ERROR] %@", refusal_->message());
  } else {
    sx_default_log().notice("[NOTICE] Extensions run unconfined, with all that their user may do, since %@. %@", reason,
                            advice);
  }
  return std::nullopt;
}

/// So that the error says what is wrong, as it does without confinement: inside, nobody could tell.
std::optional<SXError> ExtensionConfinement::checkProgram(const LaunchDescription &description,
                                                          const ExtensionBundle &bundle) const {
  const std::string &program = description.executable;
  const std::optional<std::string> resolved = resolveExistingPath(program);
  if (!resolved || ::faccessat(AT_FDCWD, program.c_str(), X_OK, AT_EACCESS) != 0) {
    return programError(errno, program, bundle.identifier.value_or(bundle.path));
  }
  const std::optional<std::string> directory = resolveExistingPath(bundle.path);
  if ((directory && pathBelow(*directory, *resolved)) || pathBelow("/usr", *resolved)) return std::nullopt;
  return hostError(HostErrorCode::noExecutable,
                   "The program " + program + " is a link to " + *resolved +
                       ", which a confined extension does not see. Put the program itself into the bundle.");
}

Result<ExtensionConfinement::Grant> ExtensionConfinement::grant(const std::string &wish, bool writable) const {
  Grant grant{wish, writable, {}};
  std::string path = wish;
  if (wish.starts_with("~/")) {
    const std::optional<std::string> home = resolveExistingPath(places_.homeDirectory);
    if (!home) return posixError(errno, "looking for the home directory");
    const std::string rest = wish.size() > 2 ? wish.substr(1) : std::string();
    path = *home + rest;
    grant.where = places_.homeDirectory + rest;
  }
  const auto overlaps = [&path](const std::string &place) -> bool {
    // A place that cannot be looked at cannot be told from this one.
    const std::optional<ResolvedPath> resolved = resolvePath(place);
    return !resolved || pathBelow(resolved->path, path) || pathBelow(path, resolved->path);
  };
  const auto refusal = [](const std::string &reason) { return hostError(HostErrorCode::notGranted, reason); };
  for (const std::string &place : places_.hidden) {
    if (overlaps(place)) return refusal("No extension may see " + place + ".");
  }
  if (overlaps(places_.extensions.groupContainersDirectory)) {
    return refusal("An extension sees its own group containers alone.");
  }
  for (const std::string &place : places_.unwritable) {
    if (writable && overlaps(place)) return refusal("No extension may write " + place + ".");
  }
  // Links could be made to lead elsewhere, by an extension that may write where they lie.
  open_how how{};
  how.flags = O_PATH | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS;
  grant.fd.reset(static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how)));
  if (!grant.fd && errno == ELOOP) return refusal("It leads through a symbolic link. Name the place itself.");
  if (!grant.fd) return posixError(errno, "opening it");
  return grant;
}

/// What lies in another place that is granted comes after it.
std::vector<ExtensionConfinement::Grant> ExtensionConfinement::grantsOf(const ExtensionBundle &bundle) const {
  std::vector<Grant> grants;
  for (const auto &[wishes, writable] :
       {std::pair{&bundle.wishes.readOnly, false}, std::pair{&bundle.wishes.readWrite, true}}) {
    for (const std::string &wish : *wishes) {
      Result<Grant> granted = grant(wish, writable);
      if (granted) {
        grants.push_back(std::move(granted.value()));
        continue;
      }
      sx_default_log().fault("[ERROR] Not granting %@ to the extension %@: %@", wish,
                             bundle.identifier.value_or(bundle.path), granted.error().message());
    }
  }
  std::stable_sort(grants.begin(), grants.end(), [](const Grant &a, const Grant &b) { return a.where < b.where; });
  return grants;
}

}  // namespace storix::linuxhost
