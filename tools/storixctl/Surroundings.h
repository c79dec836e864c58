#pragma once

#include <unistd.h>

#include <iosfwd>
#include <string>

#include "storix/ClientOptions.h"
#include "tools/storixctl/Waiting.h"

namespace storix::ctl {

/// Where one call of the program runs. `main` makes it of the process's own; tests make theirs.
struct Surroundings {
  std::string currentDirectory;
  std::string homeDirectory;
  /// The timeout is the command line's.
  ClientOptions clientOptions;

  /// Where results and complaints go, and where they end up.
  std::ostream &out;
  std::ostream &err;
  bool outputIsTerminal = false;

  /// Where the content of documents comes from and goes.
  int contentInput = STDIN_FILENO;
  int contentOutput = STDOUT_FILENO;
  /// Where progress is shown; -1 where there is nobody to see it.
  int terminal = -1;

  Waiting &waiting;
};

}  // namespace storix::ctl
