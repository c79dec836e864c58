#include "tools/storixctl/Verbs.h"

#include <algorithm>

namespace storix::ctl {

namespace {

const OperandDescription document{"DOCUMENT", "the document: a path, or a file:// URL"};
const OperandDescription provider{"PROVIDER", "identifier of the provider"};
const OperandDescription consumer{"CONSUMER", "bundle identifier of the application that gets the document"};

const OperandDescription bookmark{"BOOKMARK", "a bookmarkable string, \"storix:PROVIDER/ITEM\""};

constexpr std::string_view whoMayAsk =
    "Needs the entitlement \"com.tessel.storix.acl-read\" or \"com.tessel.storix.acl-write\".\n";

}  // namespace

std::span<const OptionDescription> options() {
  static const std::vector<OptionDescription> all{
      {Option::json, "--json", "", "", "print one JSON object, also for a failure"},
      {Option::timeout, "--timeout", "", "SECONDS", "how long to wait for an answer (60; fractions allowed)"},
      {Option::help, "--help", "-h", "", "print this help"},
      {Option::output, "--output", "-o", "FILE", "where the content goes, instead of standard output"},
      {Option::input, "--input", "-i", "FILE", "where the content comes from, instead of standard input"},
      {Option::provider, "--provider", "", "ID", "only what this provider's documents were granted to"},
      {Option::consumer, "--consumer", "", "ID", "only what this application was granted"},
      {Option::item, "--item", "", "ID", "try this document, named by its identifier (repeatable)", true},
      {Option::file, "--file", "", "PATH", "the same, named by its path among the provided items (repeatable)", true},
      {Option::container, "--container", "", "DIR", "the group's container, where a fresh one will not do"},
  };
  return all;
}

const OptionDescription *optionNamed(std::string_view name) {
  for (const OptionDescription &option : options()) {
    if (name == option.name || (!option.shortName.empty() && name == option.shortName)) return &option;
  }
  return nullptr;
}

bool isCommon(Option option) { return option == Option::json || option == Option::timeout || option == Option::help; }

bool VerbDescription::takes(Option option) const {
  return isCommon(option) || std::find(options.begin(), options.end(), option) != options.end();
}

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
       "Prints one line for each provider: its identifier and the directory where its documents\nappear. Where that is "
       "no terminal, there is a tab between them.\n",
       {}},
      {Verb::read,
       "read",
       "print the content of a document",
       "Has the document's provider put the content in place, and keeps writers away while it is read.\n"
       "Any other file is read in the same way.\n",
       {document},
       {Option::output}},
      {Verb::cat,
       "cat",
       "print the content of the document that a bookmarkable string names",
       "As read. The document must have been granted to this program.\n",
       {bookmark},
       {Option::output}},
      {Verb::write,
       "write",
       "replace the content of a document",
       "All of the new content is taken in first. Then, while nobody else reads or writes the document,\n"
       "it takes the place of the old, with the same permissions, and the document's provider is told.\n"
       "Until then, whatever fails, the old content stays. A bookmarkable string will do as well.\n",
       {{"DOCUMENT", "the document: a path, a file:// URL or a bookmarkable string"}},
       {Option::input}},
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
       {Option::output}},
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
       {bookmark}},
      {Verb::grants,
       "grants",
       "list what has been granted to whom",
       "Prints one line for each grant: the provider, the application, the item. Where that is no\n"
       "terminal, there are tabs between them. Reads the access-control file of this user and asks\n"
       "no daemon.\n",
       {},
       {Option::provider, Option::consumer}},
      {Verb::notify,
       "notify",
       "post a system notification",
       "Prints nothing.\n",
       {{"NAME", "the notification's name, such as com.tessel.mobile.vaultkeepd.first_unlock"}}},
      {Verb::checkExtension,
       "check-extension",
       "tell what is wrong with a document provider's bundle",
       "Starts the provider as the daemon would, but without a daemon and in a fresh group container,\n"
       "and asks it for everything good and bad that may be asked; then, if nothing was wrong, once\n"
       "more inside the sandbox in which the daemon runs it. Prints errors and advice, and what the\n"
       "provider prints. Name documents of the provider, or only bad input can be tried. They are\n"
       "downloaded and dropped, and not changed. Exit status 1 where there are errors.\n",
       {{"BUNDLE", "the bundle, NAME.appdex"}},
       {Option::item, Option::file, Option::container}},
  };
  return all;
}

const VerbDescription *verbNamed(std::string_view name) {
  const auto all = verbs();
  const auto found = std::find_if(all.begin(), all.end(), [name](const auto &verb) { return verb.name == name; });
  return found == all.end() ? nullptr : &*found;
}

}  // namespace storix::ctl
