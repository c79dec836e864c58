#pragma once

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Result.h"
#include "platform/URL.h"
#include "tools/storixctl/Verbs.h"

namespace storix::ctl {

/// One call of the program, understood. Operands are as many as the verb takes.
struct Invocation {
  const VerbDescription *verb = nullptr;
  std::vector<std::string> operands;
  bool json = false;
  std::chrono::milliseconds timeout{60'000};
  /// Of the options that have one and are not common to all verbs.
  std::multimap<Option, std::string> values;

  /// Null when the option was not given.
  [[nodiscard]] const std::string *value(Option option) const;
  /// Of an option that may be repeated, in order.
  [[nodiscard]] std::vector<std::string> allValues(Option option) const;
};

/// Help was asked for: of one verb, or of the program.
struct HelpRequest {
  const VerbDescription *verb = nullptr;
};

/// The call cannot be understood; the sentence says why.
struct UsageError {
  std::string sentence;
};

using ParsedArguments = std::variant<Invocation, HelpRequest, UsageError>;

/// `arguments` are those after the program's name. Options may stand anywhere before a "--".
ParsedArguments parseArguments(const std::vector<std::string> &arguments);

std::string helpText(const HelpRequest &request);

/// The URL of a document named on the command line: a "file://" URL as it stands, else a path,
/// relative ones below `currentDirectory`. A path that ends in "/" is a directory's.
Result<URL> documentURL(std::string_view operand, const std::string &currentDirectory);

}  // namespace storix::ctl
