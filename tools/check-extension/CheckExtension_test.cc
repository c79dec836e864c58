#include "tools/check-extension/CheckExtension.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>

namespace storix::check {
namespace {

namespace fs = std::filesystem;
using ::testing::AllOf;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;

/// A bundle of the faulty provider with the documents "a.txt" and "folder/b 100%.txt".
class CheckExtensionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string name = (fs::temp_directory_path() / "storix-check-test-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    directory_ = name;
    ::setenv("TMPDIR", directory_.c_str(), 1);
    check_.bundle = directory_ / "docs.appdex";
    fs::create_directories(bundle() / "documents/folder");
    fs::copy_file(STORIX_FAULTY_PROVIDER, bundle() / "provider");
    write("documents/a.txt", "the content of a document");
    write("documents/folder/b 100%.txt", "the content of another document");
    writeInfo();
    check_.takeOutputLine = [this](std::string_view line) {
      const std::lock_guard lock(mutex_);
      output_.emplace_back(line);
    };
  }
  void TearDown() override {
    EXPECT_THAT(entries(directory_), Not(Contains(HasSubstr("storix-check-")))) << "something was left behind";
    ::unsetenv("TMPDIR");
    fs::remove_all(directory_);
  }

  [[nodiscard]] fs::path bundle() const { return check_.bundle; }
  void write(const std::string &file, const std::string &content) const { std::ofstream(bundle() / file) << content; }

  /// Info.kvs, with one entry left out or another in its place.
  void writeInfo(const std::string &key = "", const std::string &entry = "") const {
    std::vector<std::pair<std::string, std::string>> entries{
        {"KTBundleIdentifier", R"("org.sample.docs")"},
        {"KTBundleExecutable", R"("provider")"},
        {"KTBundleVersion", R"("1")"},
        {"KTGroupContainers", R"(["group.org.sample.docs"])"},
        {"KTExtensionPointIdentifier", R"("com.tessel.storix-nonui")"},
        {"KTExtension", R"({"KTExtensionStorixDocumentGroup": "group.org.sample.docs"})"}};
    std::string text;
    bool isThere = entry.empty();
    for (const auto &[name, value] : entries) {
      if (name == key && entry.empty()) continue;
      isThere = isThere || name == key;
      text += std::string(text.empty() ? "{" : ",") + "\"" + name + "\": " + (name == key ? entry : value) + "\n";
    }
    if (!isThere) text += ",\"" + key + "\": " + entry;
    write("Info.kvs", text + "}");
  }

  static std::vector<std::string> entries(const fs::path &directory) {
    std::vector<std::string> names;
    for (const auto &entry : fs::directory_iterator(directory)) names.push_back(entry.path().filename().string());
    return names;
  }

  /// The sentences, each with its severity in front.
  std::vector<std::string> findings() {
    const auto found = checkExtension(check_);
    if (!found) {
      ADD_FAILURE() << found.error().message();
      return {};
    }
    std::vector<std::string> sentences;
    for (const Finding &finding : found.value()) {
      sentences.push_back((finding.severity == Severity::error ? "error: " : "advice: ") + finding.sentence);
    }
    return sentences;
  }
  std::vector<std::string> findingsWith(const std::string &fault) {
    write("fault", fault);
    return findings();
  }
  std::vector<std::string> findingsWithDocument(const std::string &fault) {
    check_.files = {"a.txt"};
    return findingsWith(fault);
  }

  fs::path directory_;
  ExtensionCheck check_;
  std::mutex mutex_;
  std::vector<std::string> output_;
};

// --- Nothing wrong

TEST_F(CheckExtensionTest, NothingIsFoundWhereNothingIsWrong) {
  check_.files = {"a.txt", "folder/b 100%.txt"};
  check_.items = {"a.txt", "folder/b 100%.txt"};
  EXPECT_THAT(findingsWith("none"), IsEmpty());
  EXPECT_THAT(output_, Contains("the fault: none"));
}

TEST_F(CheckExtensionTest, WhatTheSandboxHidesIsNamed) {
  const fs::path elsewhere = directory_ / "elsewhere";
  fs::rename(bundle() / "documents", elsewhere);
  fs::create_directory_symlink(elsewhere, bundle() / "documents");
  EXPECT_THAT(findingsWithDocument("none"),
              ElementsAre("error: Inside the sandbox in which the daemon runs it (\"KTSandbox\" asks for more): "
                          "StartProvidingItemAtURL for the file \"a.txt\": no such document"));
  writeInfo("KTSandbox", R"({"readOnly": [")" + elsewhere.string() + "\"]}");
  EXPECT_THAT(findingsWithDocument("none"), IsEmpty());
}

TEST_F(CheckExtensionTest, AContainerThatIsGivenIsUsedAndKept) {
  const fs::path container = directory_ / "container";
  fs::create_directory(container);
  check_.container = container;
  EXPECT_THAT(findingsWithDocument("none"), IsEmpty());
  EXPECT_THAT(entries(container / "Storix Storage"), ElementsAre(".a.txt"));
}

TEST_F(CheckExtensionTest, AContainerThatIsNotThereIsSaid) {
  check_.container = directory_ / "nowhere";
  const auto found = checkExtension(check_);
  ASSERT_FALSE(found);
  EXPECT_THAT(found.error().message(), HasSubstr("nowhere"));
}

TEST_F(CheckExtensionTest, ADocumentThatIsNotThereIsSaid) {
  check_.files = {"z.txt"};
  check_.items = {"../z"};
  EXPECT_THAT(findingsWith("none"),
              ElementsAre("error: URLForItemIdentifier for the item \"../z\": no such document",
                          "error: StopProvidingItemAtURL for the file \"z.txt\": no such document",
                          "error: ProvidePlaceholderAtURL for the file \"z.txt\": no such document",
                          "error: StartProvidingItemAtURL for the file \"z.txt\": no such document"));
}

// --- The bundle

TEST_F(CheckExtensionTest, EachThingThatInfoLacksIsNamed) {
  const auto finds = [this](const std::string &key, const std::string &entry, const std::string &text) {
    writeInfo(key, entry);
    EXPECT_THAT(findings(), Contains(AllOf(HasSubstr("Info.kvs: "), HasSubstr(text)))) << key << " " << entry;
  };
  finds("KTBundleIdentifier", "", "\"KTBundleIdentifier\" is missing or empty; the daemon ignores the bundle.");
  finds("KTBundleIdentifier", R"("")", "\"KTBundleIdentifier\" is missing or empty");
  finds("KTBundleIdentifier", "1", "\"KTBundleIdentifier\" must be a string");
  finds("KTBundleIdentifier", R"("org/sample")", "holds a \"/\"");
  finds("KTBundleIdentifier", R"("my docs")", "letters, digits");
  finds("KTBundleExecutable", "", "names no KTBundleExecutable");
  finds("KTBundleExecutable", R"("../provider")", "does not lie inside the bundle");
  finds("KTBundleVersion", "", "\"KTBundleVersion\" is missing");
  finds("KTExtensionPointIdentifier", "", "\"com.tessel.storix-nonui\"; it is missing.");
  finds("KTExtensionPointIdentifier", R"("com.tessel.other")", "it is \"com.tessel.other\"");
  finds("KTExtension", "", "\"KTExtension\" must be a dictionary");
  finds("KTExtension", "[]", "\"KTExtension\" must be a dictionary");
  finds("KTExtension", "{}", "must hold the string \"KTExtensionStorixDocumentGroup\"");
  finds("KTExtension", R"({"KTExtensionStorixDocumentGroup": "group.other"})",
        "the \"KTExtensionStorixDocumentGroup\" \"group.other\" is not one of the bundle's \"KTGroupContainers\"");
  finds("KTGroupContainers", "", "is not one of the bundle's \"KTGroupContainers\"");
  finds("KTGroupContainers", R"(["../x"])", "plain names");
  write("Info.kvs", "{ nonsense");
  EXPECT_THAT(findings(), ElementsAre(HasSubstr("error: Info.kvs: ")));
}

TEST_F(CheckExtensionTest, AProgramThatCannotBeRunIsNamed) {
  writeInfo("KTBundleExecutable", R"("nothing")");
  EXPECT_THAT(findings(), ElementsAre(AllOf(HasSubstr("nothing cannot be opened"), HasSubstr("No such file"))));
  writeInfo("KTBundleExecutable", R"("documents")");
  EXPECT_THAT(findings(), ElementsAre(HasSubstr("is not a file")));
  write("text", "no program");
  writeInfo("KTBundleExecutable", R"("text")");
  EXPECT_THAT(findings(), ElementsAre(HasSubstr("text is not executable; chmod +x it.")));
  fs::permissions(bundle() / "text", fs::perms(0777));
  const auto found = findings();
  EXPECT_THAT(found, Contains(HasSubstr("text can be written by every user")));
  EXPECT_THAT(found, Contains(AllOf(HasSubstr("error: The extension cannot be started: "),
                                    HasSubstr("running the program"), HasSubstr("Exec format error"))));
}

TEST_F(CheckExtensionTest, ABundleOfAnotherNameOrNoneIsNamed) {
  const fs::path other = directory_ / "docs";
  fs::rename(bundle(), other);
  EXPECT_THAT(findings(), ElementsAre(HasSubstr("cannot be opened as a directory: No such file or directory.")));
  check_.bundle = other;
  EXPECT_THAT(findings(), ElementsAre(HasSubstr("must end in \".appdex\"")));
}

// --- The process

TEST_F(CheckExtensionTest, AProcessThatEndsBeforeItsLoginIsNamed) {
  EXPECT_THAT(findingsWith("exits before its login"),
              ElementsAre("error: The extension cannot be started: The process exited with status 7 before it had "
                          "logged in."));
}

TEST_F(CheckExtensionTest, AProcessThatDoesNotEndIsNamed) {
  EXPECT_THAT(findingsWith("does not end"),
              ElementsAre("error: When the connection is closed, the process goes on for more than 5 seconds; the "
                          "daemon ends it by a signal."));
}

TEST_F(CheckExtensionTest, AProcessThatEndsWithAStatusIsNamed) {
  EXPECT_THAT(findingsWith("ends with a status"),
              ElementsAre("error: When the connection is closed, the process exited with status 4; it should exit with "
                          "status 0."));
}

TEST_F(CheckExtensionTest, AProcessThatEndsInsteadOfAnsweringIsNamedAndTheCheckGoesOn) {
  const auto found = findingsWithDocument("aborts without an argument");
  EXPECT_THAT(found, ElementsAre("error: StartProvidingItemAtURL for an absent argument: the process was killed by "
                                 "signal 6 (Aborted) instead of answering."));
}

TEST_F(CheckExtensionTest, TheCheckEndsEarlyWhereTheProcessEndsTimeAndAgain) {
  EXPECT_THAT(findingsWith("exits for a missing document"),
              ElementsAre(HasSubstr("the process exited with status 3 instead of answering."),
                          HasSubstr("the process exited with status 3 instead of answering."),
                          HasSubstr("the process exited with status 3 instead of answering."),
                          HasSubstr("The check has ended early")));
}

TEST_F(CheckExtensionTest, AQuestionWithoutAnAnswerIsNamed) {
  check_.timeout = std::chrono::milliseconds(1000);
  EXPECT_THAT(findingsWith("never answers"),
              AllOf(Contains("error: ProvidePlaceholderAtURL for a URL outside of the provided-items directory: no "
                             "answer within 1 seconds."),
                    Contains(HasSubstr("The check has ended early"))));
}

TEST_F(CheckExtensionTest, DescriptorsThatLeakAreCounted) {
  EXPECT_THAT(findingsWith("leaks descriptors"), ElementsAre(HasSubstr("it leaks them")));
}

// --- The operations

TEST_F(CheckExtensionTest, ASetupThatFailsIsNamed) {
  EXPECT_THAT(findingsWith("fails its setup"),
              Contains("error: PerformInitialSetup: the daemon leaves out a provider that answers an error: The "
                       "account is locked."));
}

TEST_F(CheckExtensionTest, ASetupThatMakesNoDirectoryIsNamed) {
  EXPECT_THAT(findingsWith("makes no directory"), ElementsAre(HasSubstr("nobody makes it but the provider")));
}

TEST_F(CheckExtensionTest, AnAnswerThatIsNeitherIdentifierNorErrorIsNamed) {
  EXPECT_THAT(findingsWith("answers neither"),
              AllOf(Contains("error: IdentifierForItemAtURL for a document that does not exist: answered neither an "
                             "identifier nor an error; the daemon takes that for success."),
                    Contains("error: IdentifierForItemAtURL for an absent argument: reported as success; it must be an "
                             "error.")));
  EXPECT_THAT(findingsWithDocument("answers neither"),
              Contains("error: IdentifierForItemAtURL for the file \"a.txt\": answered neither an identifier nor an "
                       "error; the daemon takes that for success."));
}

TEST_F(CheckExtensionTest, AnAnswerThatCannotBeReadIsNamed) {
  EXPECT_THAT(findingsWith("answers with another signature"),
              Contains(AllOf(HasSubstr("IdentifierForItemAtURL for "), HasSubstr("the answer cannot be read"))));
}

TEST_F(CheckExtensionTest, AnIdentifierOfWhatIsNoDocumentIsNamed) {
  const auto found = findingsWith("identifies everything");
  for (const char *subject : {"a URL outside of the provided-items directory", "the provided-items directory itself",
                              "a URL that \"..\" leads outside", "a URL that a symbolic link leads outside"}) {
    EXPECT_THAT(found, Contains(AllOf(HasSubstr("IdentifierForItemAtURL for " + std::string(subject)),
                                      HasSubstr("it must be an error"))));
  }
  EXPECT_THAT(found, Contains(HasSubstr("with a text that is no URL: reported as success")));
}

TEST_F(CheckExtensionTest, WritingOutsideOfTheDirectoryIsNamed) {
  const auto found = findingsWith("writes anywhere");
  for (const char *subject : {"a URL outside of the provided-items directory", "a URL that \"..\" leads outside",
                              "a URL that a symbolic link leads outside"}) {
    EXPECT_THAT(found, Contains("error: StartProvidingItemAtURL for " + std::string(subject) +
                                ": files outside of the provided-items directory were written or removed."));
  }
}

TEST_F(CheckExtensionTest, RemovingWhatIsNoDocumentIsNamed) {
  EXPECT_THAT(findingsWith("removes anything"),
              AllOf(Contains("error: StopProvidingItemAtURL for a URL outside of the provided-items directory: files "
                             "outside of the provided-items directory were written or removed."),
                    Contains("error: StopProvidingItemAtURL for the provided-items directory itself: the "
                             "provided-items directory was removed.")));
}

TEST_F(CheckExtensionTest, IdentifiersThatLeadOutsideAreNamed) {
  const auto found = findingsWith("takes identifiers for paths");
  EXPECT_THAT(found, Contains("error: URLForItemIdentifier for an empty identifier: reported as success; it must be an "
                              "error."));
  EXPECT_THAT(found, Contains(AllOf(HasSubstr("URLForItemIdentifier for the identifier \"../secret\""),
                                    HasSubstr("does not lie in the provided-items directory"))));
  EXPECT_THAT(found, Contains(HasSubstr("URLForItemIdentifier for the identifier \".\"")));
}

TEST_F(CheckExtensionTest, SuccessWithoutAFileIsNamed) {
  EXPECT_THAT(findingsWithDocument("provides nothing at all"),
              AllOf(Contains("error: StartProvidingItemAtURL for a document that does not exist: reported as success, "
                             "but there is no file."),
                    Contains("error: StartProvidingItemAtURL for the file \"a.txt\": when it was reported as there, "
                             "the file cannot be opened (No such file or directory).")));
}

TEST_F(CheckExtensionTest, AFileThatIsWrittenInPlaceIsNamed) {
  EXPECT_THAT(findingsWithDocument("writes in place"),
              Contains(HasSubstr("error: StartProvidingItemAtURL for the file \"a.txt\": the file was written to while "
                                 "it stood under its name")));
}

TEST_F(CheckExtensionTest, AFileThatIsStillWrittenAfterTheAnswerIsNamed) {
  EXPECT_THAT(findingsWithDocument("goes on after its answer"),
              Contains(HasSubstr("the file was still written to after it had been reported as there.")));
}

TEST_F(CheckExtensionTest, HalfADocumentThatIsLeftBehindIsNamed) {
  EXPECT_THAT(findingsWithDocument("leaves half a document"),
              Contains("error: StartProvidingItemAtURL for the file \"a.txt\": when the process was ended in the "
                       "middle, the file's content is not the one that was there at first."));
}

TEST_F(CheckExtensionTest, IdentifiersThatChangeAreNamed) {
  EXPECT_THAT(findingsWithDocument("gives identifiers that change"),
              AllOf(Contains(HasSubstr("the identifier was \"a.txt")), Contains(HasSubstr("leads back to")),
                    Contains(HasSubstr("asked many times at once"))));
}

TEST_F(CheckExtensionTest, IdentifiersThatDoNotOutliveTheProcessAreNamed) {
  const auto found = findingsWithDocument("gives identifiers that do not last");
  EXPECT_THAT(found, ElementsAre(HasSubstr("grants and bookmarks need one that lasts")));
}

TEST_F(CheckExtensionTest, AnIdentifierThatLeadsElsewhereIsNamed) {
  check_.items = {"a.tx"};
  EXPECT_THAT(findingsWithDocument("loses its way back"),
              AllOf(Contains(HasSubstr("its identifier \"a.txt\" leads to ")),
                    Contains("error: IdentifierForItemAtURL for the item \"a.tx\": the identifier of its URL is "
                             "\"a.txx\".")));
}

TEST_F(CheckExtensionTest, APlaceholderInTheDocumentsPlaceIsNamed) {
  EXPECT_THAT(findingsWithDocument("puts the placeholder in the document's place"),
              AllOf(Contains(HasSubstr("something stands at the document's own name now")),
                    Contains(HasSubstr("answered the document's own URL"))));
}

TEST_F(CheckExtensionTest, APlaceholderThatNobodyCanUseIsNamed) {
  const auto found = [this](const std::string &fault) { return findingsWithDocument(fault); };
  EXPECT_THAT(found("hides the placeholder"), ElementsAre(HasSubstr("is only found beside the document")));
  EXPECT_THAT(found("writes an odd placeholder"), ElementsAre(HasSubstr("nobody can read the placeholder: ")));
  EXPECT_THAT(found("leaves out the size"), ElementsAre(HasSubstr("needs the number \"size\"")));
  EXPECT_THAT(found("is wrong about the size"),
              ElementsAre("error: ProvidePlaceholderAtURL for the file \"a.txt\": the placeholder says that the "
                          "document has 1 bytes, and it has 25."));
}

TEST_F(CheckExtensionTest, APlaceholderThatIsNotThereIsNamed) {
  EXPECT_THAT(findingsWithDocument("makes up a placeholder"), Contains(HasSubstr("where there is no file")));
}

}  // namespace
}  // namespace storix::check
