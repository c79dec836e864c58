#include "tools/storixctl/Arguments.h"

#include <cctype>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <utility>

#include "platform/SXError.h"

namespace storix::ctl {

namespace {

constexpr double longestTimeout = 86'400;

std::optional<std::chrono::milliseconds> timeoutFrom(std::string_view text) {
  double seconds = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  if (!(seconds >= 0.001 && seconds <= longestTimeout)) return std::nullopt;
  return std::chrono::milliseconds(std::llround(seconds * 1000));
}

std::string synopsis(const VerbDescription &verb) {
  std::string text = "storixctl " + std::string(verb.name) + " [OPTION...]";
  for (const auto &operand : verb.operands) text += " " + std::string(operand.name);
  return text;
}

std::string padded(std::string_view text, std::size_t width) {
  return "  " + std::string(text) + std::string(text.size() < width ? width - text.size() : 1, ' ');
}

std::string optionLine(const OptionDescription &option) {
  std::string names(option.name);
  if (!option.value.empty()) names += " " + std::string(option.value);
  return padded(names, 21) + std::string(option.meaning) + "\n";
}

/// The options of a verb, its own first; without one those of every verb.
std::string optionLines(const VerbDescription *verb) {
  std::string own;
  std::string common;
  for (const OptionDescription &option : options()) {
    if (isCommon(option.option)) {
      common += optionLine(option);
    } else if (verb && verb->takes(option.option)) {
      own += optionLine(option);
    }
  }
  return own + common;
}

constexpr std::string_view exitStatuses =
    "Exit status:\n"
    "  0  done\n"
    "  1  the request was refused or failed\n"
    "  2  the command line was not understood\n"
    "  3  the daemon cannot be reached, or did not answer in time\n";

/// The value of an option: after "=", or the next argument.
class OptionReader {
 public:
  OptionReader(const std::vector<std::string> &arguments, std::size_t &index) : arguments_(arguments), index_(index) {
    const std::string &argument = arguments_[index_];
    const std::size_t equals = argument.find('=');
    name = argument.substr(0, equals);
    if (equals != std::string::npos) inlineValue_ = argument.substr(equals + 1);
  }

  std::optional<std::string> value() {
    if (inlineValue_) return inlineValue_;
    if (index_ + 1 >= arguments_.size()) return std::nullopt;
    return arguments_[++index_];
  }
  [[nodiscard]] bool hasInlineValue() const { return inlineValue_.has_value(); }

  std::string name;

 private:
  const std::vector<std::string> &arguments_;
  std::size_t &index_;
  std::optional<std::string> inlineValue_;
};

/// Takes one option into the invocation.
std::optional<UsageError> take(const OptionDescription &known, OptionReader &option, Invocation &invocation,
                               bool &help) {
  if (known.value.empty()) {
    if (option.hasInlineValue()) return UsageError{option.name + " takes no value"};
    (known.option == Option::json ? invocation.json : help) = true;
    return std::nullopt;
  }
  auto value = option.value();
  if (known.option == Option::timeout) {
    const auto timeout = value ? timeoutFrom(*value) : std::nullopt;
    if (!timeout) return UsageError{"--timeout needs a number of seconds, from 0.001 to 86400"};
    invocation.timeout = *timeout;
    return std::nullopt;
  }
  if (!value || value->empty()) {
    return UsageError{option.name + (known.value == "ID"     ? " needs an identifier"
                                     : known.value == "FILE" ? " needs the name of a file"
                                                             : " needs a path")};
  }
  if (!known.mayBeRepeated) invocation.values.erase(known.option);
  invocation.values.emplace(known.option, *std::move(value));
  return std::nullopt;
}

UsageError wrongOperandCount(const VerbDescription &verb) {
  std::string names;
  for (const auto &operand : verb.operands) names += (names.empty() ? "" : " ") + std::string(operand.name);
  return {"\"" + std::string(verb.name) + "\" takes " + (names.empty() ? "no operands" : names)};
}

}  // namespace

const std::string *Invocation::value(Option option) const {
  const auto found = values.find(option);
  return found == values.end() ? nullptr : &found->second;
}

std::vector<std::string> Invocation::allValues(Option option) const {
  std::vector<std::string> all;
  const auto [first, end] = values.equal_range(option);
  for (auto at = first; at != end; ++at) all.push_back(at->second);
  return all;
}

ParsedArguments parseArguments(const std::vector<std::string> &arguments) {
  Invocation invocation;
  bool help = false;
  bool optionsEnded = false;
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    const std::string &argument = arguments[i];
    if (optionsEnded || argument.size() < 2 || argument[0] != '-') {
      if (invocation.verb) {
        invocation.operands.push_back(argument);
      } else {
        invocation.verb = verbNamed(argument);
        if (!invocation.verb) return UsageError{"there is no verb \"" + argument + "\""};
      }
      continue;
    }
    if (argument == "--") {
      optionsEnded = true;
      continue;
    }
    OptionReader option(arguments, i);
    const OptionDescription *known = optionNamed(option.name);
    if (!known) return UsageError{"there is no option " + option.name};
    if (const auto error = take(*known, option, invocation, help)) return *error;
  }
  if (help) return HelpRequest{invocation.verb};
  if (!invocation.verb) return UsageError{"a verb is needed"};
  if (invocation.operands.size() != invocation.verb->operands.size()) return wrongOperandCount(*invocation.verb);
  for (const OptionDescription &option : options()) {
    if (!invocation.value(option.option) || invocation.verb->takes(option.option)) continue;
    return UsageError{"\"" + std::string(invocation.verb->name) + "\" takes no " + std::string(option.name)};
  }
  if (invocation.verb->takes(Option::output) && invocation.json && !invocation.value(Option::output)) {
    return UsageError{"\"" + std::string(invocation.verb->name) + "\" with --json needs --output"};
  }
  return invocation;
}

std::string helpText(const HelpRequest &request) {
  if (!request.verb) {
    std::string text = "Usage: storixctl VERB [OPTION...] [OPERAND...]\n\nAsks the document broker.\n\nVerbs:\n";
    for (const auto &verb : verbs()) text += padded(verb.name, 17) + std::string(verb.summary) + "\n";
    text += "\nOptions:\n" + optionLines(nullptr);
    text += "\n\"storixctl VERB --help\" tells more about a verb. Errors are printed on standard error.\n\n";
    return text + std::string(exitStatuses);
  }
  const VerbDescription &verb = *request.verb;
  std::string text =
      "Usage: " + synopsis(verb) + "\n\n" + std::string(verb.summary) + ".\n" + std::string(verb.details);
  const std::size_t firstLetter = text.find("\n\n") + 2;
  text[firstLetter] = static_cast<char>(std::toupper(static_cast<unsigned char>(text[firstLetter])));
  if (!verb.operands.empty()) text += "\nOperands:\n";
  for (const auto &operand : verb.operands) text += padded(operand.name, 13) + std::string(operand.meaning) + "\n";
  return text + "\nOptions:\n" + optionLines(&verb) + "\n" + std::string(exitStatuses);
}

Result<URL> documentURL(std::string_view operand, const std::string &currentDirectory) {
  if (operand.starts_with("file:")) {
    std::string reason;
    if (auto url = URL::fromString(operand, &reason)) return *url;
    return posixError(EINVAL, "reading the URL \"" + std::string(operand) + "\": " + reason);
  }
  if (operand.empty()) return posixError(EINVAL, "reading the name of a document: it is empty");
  const std::string path =
      operand.starts_with('/') ? std::string(operand) : currentDirectory + "/" + std::string(operand);
  if (auto url = URL::fileURLWithPath(path, path.ends_with('/'))) return *url;
  return posixError(EINVAL, "making a URL of the path \"" + path + "\"");
}

}  // namespace storix::ctl
