#include <unistd.h>

#include <clocale>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <string>
#include <system_error>
#include <variant>
#include <vector>

#include "storix/Client.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Commands.h"

int main(int count, char **values) {
  using namespace storix::ctl;
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
  std::error_code unknown;
  const std::string currentDirectory = std::filesystem::current_path(unknown).string();
  const char *home = std::getenv("HOME");
  Surroundings surroundings{currentDirectory, home ? home : "", std::cout, std::cerr, ::isatty(STDOUT_FILENO) == 1};
  storix::ClientOptions options;
  options.timeout = invocation.timeout;
  storix::Client client(options);
  return runCommand(invocation, client, surroundings);
}
