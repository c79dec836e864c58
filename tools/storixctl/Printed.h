#pragma once

#include <string>

#include "platform/Result.h"
#include "platform/Value.h"

namespace storix::ctl {

/// What a verb gives: the same thing for programs and for people.
struct Printed {
  Dictionary json;
  std::string text;
  /// The exit status says that something is wrong, and this tells what.
  bool isFailure = false;
};

/// Names and paths come from elsewhere and could hold what a terminal obeys: control characters
/// become "?".
std::string printable(std::string text);

}  // namespace storix::ctl
