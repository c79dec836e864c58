#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <clocale>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <string>
#include <system_error>
#include <variant>
#include <vector>

#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Commands.h"
#include "tools/storixctl/Transfers.h"

namespace {

/// A standard stream that is closed must not become another name of the next file that is opened:
/// using it fails instead.
void occupyClosedStreams() {
  for (const auto &[descriptor, flags] :
       {std::pair(STDIN_FILENO, O_WRONLY), std::pair(STDOUT_FILENO, O_RDONLY), std::pair(STDERR_FILENO, O_RDONLY)}) {
    if (::fcntl(descriptor, F_GETFD) == -1 && errno == EBADF) (void)::open("/dev/null", flags);
  }
}

}  // namespace

int main(int count, char **values) {
  using namespace storix::ctl;
  occupyClosedStreams();
  (void)std::setlocale(LC_CTYPE, "");
  const std::vector<std::string> arguments(values + (count > 0 ? 1 : 0), values + count);
  const ParsedArguments parsed = parseArguments(arguments);
  if (const auto *help = std::get_if<HelpRequest>(&parsed)) {
    std::cout << helpText(*help) << std::flush;
    return std::cout ? done : requestFailed;
  }
  if (const auto *error = std::get_if<UsageError>(&parsed)) {
    std::cerr << "storixctl: " << error->sentence << "\nTry \"storixctl --help\"." << std::endl;
    return notUnderstood;
  }
  const auto &invocation = std::get<Invocation>(parsed);
  ProcessWaiting waiting;
  if (movesContent(*invocation.verb)) waiting.watchSignals();
  const char *home = std::getenv("HOME");
  std::error_code unknown;
  return runCommand(invocation, {.currentDirectory = std::filesystem::current_path(unknown).string(),
                                 .homeDirectory = home ? home : "",
                                 .clientOptions = {},
                                 .out = std::cout,
                                 .err = std::cerr,
                                 .outputIsTerminal = ::isatty(STDOUT_FILENO) == 1,
                                 .terminal = ::isatty(STDERR_FILENO) == 1 ? STDERR_FILENO : -1,
                                 .waiting = waiting});
}
