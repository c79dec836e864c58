#pragma once

#include <chrono>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Result.h"
#include "platform/URL.h"

namespace storix::ctl {

enum class Verb { wake, providers, extend, placeholder, start, stop, open, share, bookmark, resolve, notify };

struct OperandDescription {
  std::string_view name;
  std::string_view meaning;
};

struct VerbDescription {
  Verb verb;
  std::string_view name;
  std::string_view summary;  ///< one line
  std::string_view details;  ///< what it needs and what it prints
  std::vector<OperandDescription> operands;
  bool takesOutput = false;
};

/// All verbs, in the order of the help.
std::span<const VerbDescription> verbs();

/// One call of the program, understood. Operands are as many as the verb takes.
struct Invocation {
  const VerbDescription *verb = nullptr;
  std::vector<std::string> operands;
  bool json = false;
  std::chrono::milliseconds timeout{60'000};
  std::optional<std::string> output;
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
