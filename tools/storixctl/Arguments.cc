#include "tools/storixctl/Arguments.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cmath>

#include "platform/SXError.h"

namespace storix::ctl {

namespace {

constexpr double longestTimeout = 86'400;

const OperandDescription document{"DOCUMENT", "the document: a path, or a file:// URL"};
const OperandDescription provider{"PROVIDER", "identifier of the provider"};
const OperandDescription consumer{"CONSUMER", "bundle identifier of the application that gets the document"};

constexpr std::string_view whoMayAsk =
    "Needs the entitlement \"com.tessel.storix.acl-read\" or \"com.tessel.storix.acl-write\".\n";

const VerbDescription *verbNamed(std::string_view name) {
  const auto all = verbs();
  const auto found = std::find_if(all.begin(), all.end(), [name](const auto &verb) { return verb.name == name; });
  return found == all.end() ? nullptr : &*found;
}

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

constexpr std::string_view commonOptions =
    "  --json               print one JSON object, also for a failure\n"
    "  --timeout SECONDS    how long to wait for an answer (60; fractions allowed)\n"
    "  --help               print this help\n";

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

UsageError wrongOperandCount(const VerbDescription &verb) {
  std::string names;
  for (const auto &operand : verb.operands) names += (names.empty() ? "" : " ") + std::string(operand.name);
  return {"\"" + std::string(verb.name) + "\" takes " + (names.empty() ? "no operands" : names)};
}

}  // namespace

std::span<const VerbDescription> verbs() {
  static const std::vector<VerbDescription> all{
      {Verb::wake,
       "wake",
       "have the daemon answer",
       "Starts the daemon where it is started on demand. Prints nothing.\n",
       {}},
      {Verb::providers,
       "providers",
       "list the document providers",
       "Prints one line for each provider: its identifier, a tab, the directory where its\ndocuments appear.\n",
       {}},
      {Verb::extend,
       "extend",
       "grant a document to an application",
       "Records the grant and prints the tokens that open the document and its companion file.\n"
       "Needs the entitlement \"com.tessel.storix.acl-write\".\n",
       {document, provider, consumer}},
      {Verb::placeholder,
       "placeholder",
       "have the placeholder of a document made",
       whoMayAsk,
       {document, provider, consumer}},
      {Verb::start,
       "start",
       "have a document downloaded",
       "Returns when the document is there. The application must have been granted it.\n",
       {document, provider, consumer}},
      {Verb::stop,
       "stop",
       "tell the provider that a document is not needed any more",
       whoMayAsk,
       {document, provider, consumer}},
      {Verb::open,
       "open",
       "print the content of a document that a token opens",
       "With --json the content goes to the file that --output names, and its size is printed.\n",
       {{"TOKEN", "a token as extend and resolve print it"}},
       true},
      {Verb::share,
       "share",
       "grant a document you can write to another application",
       "Prints the bookmarkable string that the application resolves.\n",
       {document, consumer}},
      {Verb::bookmark, "bookmark", "print the bookmarkable string of a document", "Grants nothing.\n", {document}},
      {Verb::resolve,
       "resolve",
       "find the document that a bookmarkable string names",
       "Prints its URL and the tokens that open it. The document must have been granted to this\nprogram. There is no "
       "answer when the provider is not installed.\n",
       {{"STRING", "a bookmarkable string, \"storix:PROVIDER/ITEM\""}}},
      {Verb::notify,
       "notify",
       "post a system notification",
       "Prints nothing.\n",
       {{"NAME", "the notification's name, such as com.tessel.mobile.vaultkeepd.first_unlock"}}},
  };
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
    if (option.name == "--help" || option.name == "-h" || option.name == "--json") {
      if (option.hasInlineValue()) return UsageError{option.name + " takes no value"};
      (option.name == "--json" ? invocation.json : help) = true;
    } else if (option.name == "--timeout") {
      const auto value = option.value();
      const auto timeout = value ? timeoutFrom(*value) : std::nullopt;
      if (!timeout) return UsageError{"--timeout needs a number of seconds, from 0.001 to 86400"};
      invocation.timeout = *timeout;
    } else if (option.name == "--output" || option.name == "-o") {
      invocation.output = option.value();
      if (!invocation.output || invocation.output->empty())
        return UsageError{option.name + " needs the name of a file"};
    } else {
      return UsageError{"there is no option " + option.name};
    }
  }
  if (help) return HelpRequest{invocation.verb};
  if (!invocation.verb) return UsageError{"a verb is needed"};
  if (invocation.operands.size() != invocation.verb->operands.size()) return wrongOperandCount(*invocation.verb);
  if (invocation.output && !invocation.verb->takesOutput) {
    return UsageError{"\"" + std::string(invocation.verb->name) + "\" takes no --output"};
  }
  if (invocation.verb->takesOutput && invocation.json && !invocation.output) {
    return UsageError{"\"" + std::string(invocation.verb->name) + "\" with --json needs --output"};
  }
  return invocation;
}

std::string helpText(const HelpRequest &request) {
  if (!request.verb) {
    std::string text = "Usage: storixctl VERB [OPTION...] [OPERAND...]\n\nAsks the document broker.\n\nVerbs:\n";
    for (const auto &verb : verbs()) text += padded(verb.name, 13) + std::string(verb.summary) + "\n";
    text += "\nOptions:\n" + std::string(commonOptions);
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
  text += "\nOptions:\n";
  if (verb.takesOutput) text += "  --output FILE        where the content goes, instead of standard output\n";
  return text + std::string(commonOptions) + "\n" + std::string(exitStatuses);
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
