#include "platform/linux/HostEnvironment.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

namespace storix::linuxhost {
namespace {

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

const EnvironmentVariables ordinary = {{"HOME", "/home/ada"}, {"XDG_RUNTIME_DIR", "/run/user/7"}};

EnvironmentVariables with(EnvironmentVariables more) {
  more.insert(ordinary.begin(), ordinary.end());
  return more;
}

HostEnvironment read(const EnvironmentVariables &variables) {
  Result<HostEnvironment> environment = HostEnvironment::fromVariables(variables);
  EXPECT_TRUE(environment.ok()) << environment.error().message();
  return environment ? environment.value() : HostEnvironment();
}

std::string refusalOf(const EnvironmentVariables &variables) {
  const Result<HostEnvironment> environment = HostEnvironment::fromVariables(variables);
  return environment ? std::string() : environment.error().message();
}

TEST(HostEnvironmentTest, DefaultsAreThoseOfXDG) {
  const HostEnvironment environment = read(ordinary);
  EXPECT_EQ(environment.homeDirectory, "/home/ada");
  EXPECT_EQ(environment.runtimeDirectory, "/run/user/7/storix");
  EXPECT_EQ(environment.extensionPlaces.groupContainersDirectory, "/home/ada/.local/share/storix/groups");
  EXPECT_THAT(environment.extensionPlaces.extensionDirectories,
              ElementsAre("/home/ada/.local/share/storix/extensions", "/usr/local/share/storix/extensions",
                          "/usr/share/storix/extensions"));
  EXPECT_THAT(environment.applicationDirectories,
              ElementsAre("/home/ada/.local/share/storix/applications", "/usr/local/share/storix/applications",
                          "/usr/share/storix/applications"));
  EXPECT_EQ(environment.logSeverity, LogSeverity::standard);
  EXPECT_FALSE(environment.logsToJournal);
  EXPECT_THAT(environment.warnings, IsEmpty());
}

TEST(HostEnvironmentTest, DataDirectoriesAreTakenFromXDG) {
  const HostEnvironment environment = read(with({{"XDG_DATA_HOME", "/data/"}, {"XDG_DATA_DIRS", "/a:/b/::/a"}}));
  EXPECT_EQ(environment.extensionPlaces.groupContainersDirectory, "/data/storix/groups");
  EXPECT_THAT(environment.extensionPlaces.extensionDirectories,
              ElementsAre("/data/storix/extensions", "/a/storix/extensions", "/b/storix/extensions"));
  EXPECT_THAT(environment.applicationDirectories,
              ElementsAre("/data/storix/applications", "/a/storix/applications", "/b/storix/applications"));
}

TEST(HostEnvironmentTest, RelativePathsOfXDGAreIgnored) {
  const HostEnvironment environment = read(with({{"XDG_DATA_HOME", "data"}, {"XDG_DATA_DIRS", "a:../b"}}));
  EXPECT_EQ(environment.extensionPlaces.groupContainersDirectory, "/home/ada/.local/share/storix/groups");
  EXPECT_THAT(environment.applicationDirectories,
              ElementsAre("/home/ada/.local/share/storix/applications", "/usr/local/share/storix/applications",
                          "/usr/share/storix/applications"));
  EXPECT_THAT(environment.warnings, IsEmpty());
}

TEST(HostEnvironmentTest, OwnPathsTakeThePlaceOfAllOthers) {
  const HostEnvironment environment = read(
      with({{"STORIX_EXTENSIONS_PATH", "/x:/y"}, {"STORIX_APPLICATIONS_PATH", "/z/"}, {"STORIX_RUNTIME_DIR", "/r/"}}));
  EXPECT_EQ(environment.runtimeDirectory, "/r");
  EXPECT_THAT(environment.extensionPlaces.extensionDirectories, ElementsAre("/x", "/y"));
  EXPECT_THAT(environment.applicationDirectories, ElementsAre("/z"));
}

TEST(HostEnvironmentTest, EmptyOwnPathNamesNothing) {
  const HostEnvironment environment = read(with({{"STORIX_EXTENSIONS_PATH", ""}, {"STORIX_APPLICATIONS_PATH", ":"}}));
  EXPECT_THAT(environment.extensionPlaces.extensionDirectories, IsEmpty());
  EXPECT_THAT(environment.applicationDirectories, IsEmpty());
  EXPECT_THAT(environment.warnings, IsEmpty());
}

TEST(HostEnvironmentTest, RelativeEntryOfAnOwnPathIsLeftOutWithAWarning) {
  const HostEnvironment environment =
      read(with({{"STORIX_EXTENSIONS_PATH", "x:/y"}, {"STORIX_APPLICATIONS_PATH", "./z"}}));
  EXPECT_THAT(environment.extensionPlaces.extensionDirectories, ElementsAre("/y"));
  EXPECT_THAT(environment.applicationDirectories, IsEmpty());
  EXPECT_THAT(environment.warnings, ElementsAre(AllOf(HasSubstr("STORIX_EXTENSIONS_PATH"), HasSubstr("“x”")),
                                                AllOf(HasSubstr("STORIX_APPLICATIONS_PATH"), HasSubstr("“./z”"))));
}

TEST(HostEnvironmentTest, MissingRuntimeDirectoryIsRefusedWithWhatToDo) {
  const auto sentence = AllOf(HasSubstr("XDG_RUNTIME_DIR is not set"), HasSubstr("set STORIX_RUNTIME_DIR"));
  EXPECT_THAT(refusalOf({{"HOME", "/home/ada"}}), sentence);
  EXPECT_THAT(refusalOf({{"HOME", "/home/ada"}, {"XDG_RUNTIME_DIR", ""}, {"STORIX_RUNTIME_DIR", ""}}), sentence);
}

TEST(HostEnvironmentTest, RelativeRuntimeDirectoryIsRefused) {
  EXPECT_THAT(refusalOf({{"HOME", "/home/ada"}, {"XDG_RUNTIME_DIR", "run"}}),
              AllOf(HasSubstr("XDG_RUNTIME_DIR is “run”"), HasSubstr("not an absolute path")));
  EXPECT_THAT(refusalOf(with({{"STORIX_RUNTIME_DIR", "run\n"}})),
              AllOf(HasSubstr("STORIX_RUNTIME_DIR is “run\\n”"), HasSubstr("not an absolute path")));
}

TEST(HostEnvironmentTest, RelativeHomeIsRefusedAndAMissingOneIsLookedUp) {
  EXPECT_THAT(refusalOf({{"HOME", "ada"}, {"XDG_RUNTIME_DIR", "/r"}}), HasSubstr("HOME is “ada”"));
  EXPECT_TRUE(read({{"XDG_RUNTIME_DIR", "/r"}}).homeDirectory.starts_with('/'));
}

TEST(HostEnvironmentTest, LogLevelIsRead) {
  EXPECT_EQ(read(with({{"STORIX_LOG", "fault"}})).logSeverity, LogSeverity::fault);
  EXPECT_EQ(read(with({{"STORIX_LOG", "default"}})).logSeverity, LogSeverity::standard);
  EXPECT_EQ(read(with({{"STORIX_LOG", "info"}})).logSeverity, LogSeverity::info);
  EXPECT_EQ(read(with({{"STORIX_LOG", "debug"}})).logSeverity, LogSeverity::debug);
  EXPECT_EQ(read(with({{"STORIX_LOG", ""}})).logSeverity, LogSeverity::standard);
}

TEST(HostEnvironmentTest, UnknownLogLevelIsDefaultWithOneWarning) {
  const HostEnvironment environment = read(with({{"STORIX_LOG", "loud\x1b"}}));
  EXPECT_EQ(environment.logSeverity, LogSeverity::standard);
  EXPECT_THAT(environment.warnings,
              ElementsAre(AllOf(HasSubstr("STORIX_LOG is “loud\\x1b”"), HasSubstr("default is used"))));
}

TEST(HostEnvironment, ConfinementIsRequiredWhereTheWordIsNotUnderstood) {
  EXPECT_EQ(read(with({})).confinement, ConfinementPolicy::preferred);
  EXPECT_EQ(read(with({{"STORIX_CONFINEMENT", ""}})).confinement, ConfinementPolicy::preferred);
  EXPECT_EQ(read(with({{"STORIX_CONFINEMENT", "preferred"}})).confinement, ConfinementPolicy::preferred);
  EXPECT_EQ(read(with({{"STORIX_CONFINEMENT", "off"}})).confinement, ConfinementPolicy::off);
  EXPECT_EQ(read(with({{"STORIX_CONFINEMENT", "required"}})).confinement, ConfinementPolicy::required);
  const HostEnvironment environment = read(with({{"STORIX_CONFINEMENT", "of\n"}}));
  EXPECT_EQ(environment.confinement, ConfinementPolicy::required);
  EXPECT_THAT(
      environment.warnings,
      ElementsAre("STORIX_CONFINEMENT is “of\\n”, which is none of off, preferred and required; required is used."));
}

TEST(HostEnvironment, SessionsRuntimeDirectoryIsKnownWhereverTheSocketsAre) {
  EXPECT_EQ(read(with({{"XDG_RUNTIME_DIR", "/run/user/7/"}, {"STORIX_RUNTIME_DIR", "/x"}})).sessionRuntimeDirectory,
            "/run/user/7");
  EXPECT_EQ(read(with({{"XDG_RUNTIME_DIR", "relative"}, {"STORIX_RUNTIME_DIR", "/x"}})).sessionRuntimeDirectory, "");
}

TEST(HostEnvironmentTest, JournalIsUsedWhenStandardErrorIsItsStream) {
  struct stat status {};
  ASSERT_EQ(::fstat(STDERR_FILENO, &status), 0);
  const std::string stream = std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
  EXPECT_TRUE(read(with({{"JOURNAL_STREAM", stream}})).logsToJournal);
  EXPECT_FALSE(read(with({{"JOURNAL_STREAM", stream + "1"}})).logsToJournal);
}

TEST(HostEnvironmentTest, ExtensionsGetAnEnvironmentThatIsBuilt) {
  const HostEnvironment environment = read(with({{"PATH", "/bin"},
                                                 {"LANG", "C.UTF-8"},
                                                 {"XDG_DATA_HOME", "/data"},
                                                 {"SECRET", "x"},
                                                 {"LD_PRELOAD", "y"},
                                                 {"STORIX_RUNTIME_DIR", "/r/"},
                                                 {"STORIX_LOG", "debug"}}));
  EXPECT_THAT(environment.extensionEnvironment,
              UnorderedElementsAre("HOME=/home/ada", "PATH=/bin", "LANG=C.UTF-8", "XDG_DATA_HOME=/data",
                                   "XDG_RUNTIME_DIR=/run/user/7", "STORIX_RUNTIME_DIR=/r"));
}

TEST(HostEnvironmentTest, TheProcessEnvironmentIsRead) {
  ::setenv("STORIX_TEST_VARIABLE", "a=b", 1);
  EXPECT_EQ(processEnvironment().at("STORIX_TEST_VARIABLE"), "a=b");
  ::unsetenv("STORIX_TEST_VARIABLE");
  EXPECT_FALSE(processEnvironment().contains("STORIX_TEST_VARIABLE"));
}

}  // namespace
}  // namespace storix::linuxhost
