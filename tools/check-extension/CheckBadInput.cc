#include "tools/check-extension/CheckBadInput.h"

#include <array>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <optional>
#include <system_error>
#include <utility>
#include <vector>

namespace storix::check {

namespace {

namespace fs = std::filesystem;

constexpr const char *linkName = "storix-check-link";
constexpr const char *secret = "nobody's business";

/// Changes come before anything could have been provided that there would be to save.
constexpr std::array itemOperations{Operation::itemIdentifier, Operation::providePlaceholder, Operation::itemChanged,
                                    Operation::startProviding, Operation::stopProviding};

/// A directory with a file in it, and a way to tell whether anybody has touched them.
class Outside {
 public:
  explicit Outside(fs::path directory) : directory_(std::move(directory)) {
    std::error_code failed;
    fs::create_directories(directory_, failed);
    std::ofstream(directory_ / "secret") << secret;
  }

  [[nodiscard]] const fs::path &directory() const { return directory_; }

  /// Puts everything back, so that the next operation is not blamed.
  bool wasTouched() {
    std::error_code failed;
    std::size_t entries = 0;
    for (auto entry = fs::directory_iterator(directory_, failed); !failed && entry != fs::directory_iterator();
         entry.increment(failed)) {
      ++entries;
    }
    std::ifstream file(directory_ / "secret");
    const std::string content{std::istreambuf_iterator<char>(file), {}};
    if (!failed && entries == 1 && content == secret) return false;
    fs::remove_all(directory_, failed);
    *this = Outside(directory_);
    return true;
  }

 private:
  fs::path directory_;
};

/// A symbolic link in the provided-items directory that leads out of it, as long as it lives.
class LinkOut {
 public:
  LinkOut(const URL &storage, const fs::path &target) : path_(fs::path(storage.path()) / linkName) {
    std::error_code failed;
    fs::create_directory_symlink(target, path_, failed);
    made_ = !failed;
  }
  ~LinkOut() {
    std::error_code ignored;
    if (made_) fs::remove(path_, ignored);
  }
  LinkOut(const LinkOut &) = delete;
  LinkOut &operator=(const LinkOut &) = delete;

 private:
  fs::path path_;
  bool made_ = false;
};

/// Of a change or an end nobody can tell from the answer whether anything was done.
bool mustFail(Operation operation) {
  return operation != Operation::itemChanged && operation != Operation::stopProviding;
}

void checkForeignURL(CheckedExtension &extension, const URL &url, const std::string &subject, const URL &storage,
                     Outside &outside) {
  for (const Operation operation : itemOperations) {
    const std::string what = std::string(operationName(operation)) + " for " + subject;
    const auto answer = extension.ask(operation, Value(url), subject);
    if (answer && !failureOf(*answer) && mustFail(operation)) {
      extension.findings().error(what +
                                 ": reported as success; it must be an error, for that is no document of the "
                                 "provider's.");
    }
    if (outside.wasTouched()) {
      extension.findings().error(what + ": files outside of the provided-items directory were written or removed.");
    }
    std::error_code failed;
    if (!fs::is_directory(storage.path(), failed)) {
      extension.findings().error(what + ": the provided-items directory was removed.");
      fs::create_directories(storage.path(), failed);
    }
  }
}

void checkMissingDocument(CheckedExtension &extension, const URL &storage) {
  const URL url = storage.appendingPathComponent("storix-check/no such document 100% \xc3\xa9");
  const std::string subject = "a document that does not exist";
  for (const Operation operation : itemOperations) {
    const auto answer = extension.ask(operation, Value(url), subject);
    std::error_code failed;
    const bool isThere = fs::exists(url.path(), failed);
    if (!answer || failureOf(*answer)) {
      if (answer && isThere) {
        extension.findings().error(std::string(operationName(operation)) + " for " + subject +
                                   ": an error is reported, and yet something stands under the name.");
      }
    } else if (operation == Operation::startProviding && !isThere) {
      extension.findings().error("StartProvidingItemAtURL for " + subject +
                                 ": reported as success, but there is no file.");
    } else if (operation == Operation::startProviding) {
      extension.findings().advice("StartProvidingItemAtURL for " + subject +
                                  ": a document appeared under a name that was made up; is every name a document?");
    } else if (operation == Operation::itemIdentifier && answer->string.value_or("").empty()) {
      extension.findings().error("IdentifierForItemAtURL for " + subject +
                                 ": answered neither an identifier nor an error; the daemon takes that for success.");
    }
  }
  if (const auto placed = extension.ask(Operation::stopProviding, Value(url), subject); placed) {
    std::error_code ignored;
    fs::remove(url.path(), ignored);
    fs::remove(url.deletingLastPathComponent().path(), ignored);
  }
}

void checkAbsence(CheckedExtension &extension) {
  for (const Operation operation : {Operation::itemIdentifier, Operation::providePlaceholder, Operation::startProviding,
                                    Operation::itemChanged, Operation::stopProviding, Operation::itemURL}) {
    const auto answer = extension.ask(operation, std::nullopt, "an absent argument");
    if (answer && !failureOf(*answer)) {
      extension.findings().error(std::string(operationName(operation)) +
                                 " for an absent argument: reported as success; it must be an error.");
    }
  }
}

void checkIdentifiers(CheckedExtension &extension, const URL &storage) {
  const std::vector<std::pair<std::string, std::string>> identifiers{
      {"an empty identifier", ""},
      {"the identifier \"/etc/passwd\"", "/etc/passwd"},
      {"the identifier \"../secret\"", "../secret"},
      {"the identifier \"a/../../secret\"", "a/../../secret"},
      {"the identifier \".\"", "."},
      {"the identifier \"%2e%2e%2fsecret\"", "%2e%2e%2fsecret"},
      {"the identifier \"a b \xc3\xa9 100%\"", "a b \xc3\xa9 100%"},
      {"an identifier of 20,000 bytes", std::string(20'000, 'x')},
  };
  for (const auto &[subject, identifier] : identifiers) {
    const auto answer = extension.ask(Operation::itemURL, Value(identifier), subject);
    if (!answer || failureOf(*answer)) continue;
    const std::string what = "URLForItemIdentifier for " + subject + ": ";
    if (identifier.empty()) {
      extension.findings().error(what + "reported as success; it must be an error.");
    } else if (!answer->url) {
      extension.findings().error(what + "answered neither a URL nor an error; the daemon takes that for success.");
    } else if (!liesBelow(*answer->url, storage)) {
      extension.findings().error(what + "answered " + answer->url->absoluteString() +
                                 ", which does not lie in the provided-items directory.");
    }
  }
}

/// Names that are easily got wrong, one after another and all at once.
void checkNames(CheckedExtension &extension, const URL &storage) {
  const std::string subject = "a name with spaces, \"%\" and \"\xc3\xa9\"";
  std::vector<CheckedExtension::Question> questions;
  std::map<URL, ExtensionAnswer> answers;
  bool ledAstray = false;
  for (const char *name : {"a b", "100%", "%20", "\xc3\xa9t\xc3\xa9", "a#b?c", "x/y z", "~", "a:b"}) {
    const URL url = storage.appendingPathComponent(name);
    const auto answer = extension.ask(Operation::itemIdentifier, Value(url), subject);
    if (!answer) continue;
    answers.emplace(url, *answer);
    for (int i = 0; i < 8; ++i) questions.emplace_back(Operation::itemIdentifier, Value(url));
    if (failureOf(*answer) || !answer->string) continue;
    const auto back = extension.ask(Operation::itemURL, Value(*answer->string), subject);
    if (back && back->url && *back->url != url && !std::exchange(ledAstray, true)) {
      extension.findings().error("IdentifierForItemAtURL for " + subject + ": the identifier \"" + *answer->string +
                                 "\" of " + url.absoluteString() + " leads back to " + back->url->absoluteString() +
                                 ".");
    }
  }
  const auto atOnce = extension.askAtOnce(questions, subject + ", many at once");
  for (std::size_t i = 0; i < atOnce.size(); ++i) {
    if (!atOnce[i] || atOnce[i]->string == answers.at(*questions[i].second->url()).string) continue;
    extension.findings().error(
        "IdentifierForItemAtURL: asked many times at once, it answers another identifier than "
        "when it is asked once.");
  }
  // A name that no text can hold has no identifier. Any error will do.
  const auto latin = extension.ask(Operation::itemIdentifier, Value(storage.appendingPathComponent("caf\xe9")),
                                   "a name that is not UTF-8");
  if (latin && !failureOf(*latin) && latin->string.value_or("").empty()) {
    extension.findings().error(
        "IdentifierForItemAtURL for a name that is not UTF-8: answered neither an identifier "
        "nor an error; the daemon takes that for success.");
  }
}

void checkMisfits(CheckedExtension &extension) {
  using Misfit = StartedExtension::Misfit;
  for (const auto &[misfit, subject] : std::initializer_list<std::pair<Misfit, std::string>>{
           {Misfit::method, "A message of a method that the protocol does not have"},
           {Misfit::type, "IdentifierForItemAtURL with an argument of another type"},
           {Misfit::url, "IdentifierForItemAtURL with a text that is no URL"}}) {
    const auto answer = extension.askMisfit(misfit, subject);
    if (answer && !failureOf(*answer)) {
      extension.findings().error(subject + ": reported as success; it must be an error.");
    }
  }
}

}  // namespace

bool liesBelow(const URL &url, const URL &directory) {
  const fs::path relative =
      fs::path(url.path()).lexically_normal().lexically_relative(fs::path(directory.path()).lexically_normal());
  return !relative.empty() && relative != "." && *relative.begin() != "..";
}

void checkBadInput(CheckedExtension &extension, const URL &storage, const std::string &workingDirectory) {
  Outside outside(fs::path(workingDirectory) / "outside");
  const auto secretURL = *URL::fileURLWithPath((outside.directory() / "secret").string());
  checkForeignURL(extension, secretURL, "a URL outside of the provided-items directory", storage, outside);
  checkForeignURL(extension, storage, "the provided-items directory itself", storage, outside);
  const std::string way = fs::path(secretURL.path()).lexically_relative(storage.path()).string();
  checkForeignURL(extension, storage.appendingPathComponent(way), "a URL that \"..\" leads outside", storage, outside);
  {
    const LinkOut link(storage, outside.directory());
    checkForeignURL(extension, storage.appendingPathComponent(std::string(linkName) + "/secret"),
                    "a URL that a symbolic link leads outside", storage, outside);
  }
  checkMissingDocument(extension, storage);
  checkAbsence(extension);
  checkIdentifiers(extension, storage);
  checkNames(extension, storage);
  checkMisfits(extension);
}

}  // namespace storix::check
