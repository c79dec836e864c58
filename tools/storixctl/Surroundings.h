#pragma once

#include <iosfwd>
#include <string>

namespace storix::ctl {

/// Where one call of the program runs. `main` makes it of the process's own; tests make theirs.
struct Surroundings {
  std::string currentDirectory;
  std::string homeDirectory;
  std::ostream &out;
  std::ostream &err;
  bool outputIsTerminal = false;
};

}  // namespace storix::ctl
