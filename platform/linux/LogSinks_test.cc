#include "platform/linux/LogSinks.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

struct Pipe {
  Pipe() {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) == 0) {
      reading = UniqueFd(ends[0]);
      writing = UniqueFd(ends[1]);
    }
  }
  /// Everything that was written, once the writing end is closed.
  [[nodiscard]] std::string content() const {
    std::string text;
    char buffer[4096];
    for (ssize_t n = 0; (n = ::read(reading.get(), buffer, sizeof buffer)) > 0;) {
      text.append(buffer, static_cast<std::size_t>(n));
    }
    return text;
  }
  UniqueFd reading;
  UniqueFd writing;
};

TEST(LogSinksTest, EachLevelLetsItsOwnAndWhatIsGraverThrough) {
  const std::vector<std::pair<std::string, std::vector<bool>>> rows = {
      {"fault", {false, false, false, true}},
      {"default", {false, false, true, true}},
      {"info", {false, true, true, true}},
      {"debug", {true, true, true, true}},
  };
  for (const auto &[name, enabled] : rows) {
    const auto least = logSeverityNamed(name);
    ASSERT_TRUE(least) << name;
    for (const auto &sink : {makeLineLogSink(*least, STDERR_FILENO), makeJournalLogSink(*least)}) {
      EXPECT_EQ(sink->isEnabled(LogSeverity::debug), enabled[0]) << name;
      EXPECT_EQ(sink->isEnabled(LogSeverity::info), enabled[1]) << name;
      EXPECT_EQ(sink->isEnabled(LogSeverity::standard), enabled[2]) << name;
      EXPECT_EQ(sink->isEnabled(LogSeverity::fault), enabled[3]) << name;
    }
  }
}

TEST(LogSinksTest, UnknownLevelIsNone) {
  EXPECT_EQ(logSeverityNamed("verbose"), std::nullopt);
  EXPECT_EQ(logSeverityNamed(""), std::nullopt);
  EXPECT_EQ(logSeverityNamed("Debug"), std::nullopt);
}

TEST(LogSinksTest, LinesOfSeveralThreadsNeverMix) {
  Pipe pipe;
  const auto sink = makeLineLogSink(LogSeverity::debug, pipe.writing.get());
  std::string content;
  std::thread reader([&content, &pipe] { content = pipe.content(); });
  std::vector<std::thread> writers;
  for (char letter : {'a', 'b', 'c', 'd'}) {
    // Some longer than a pipe takes at once.
    writers.emplace_back([&sink, letter] {
      for (std::size_t i = 1; i <= 100; ++i) sink->write(LogSeverity::fault, std::string(i * 97, letter));
    });
  }
  for (std::thread &writer : writers) writer.join();
  pipe.writing.reset();
  reader.join();

  std::map<char, std::size_t> lines;
  std::istringstream stream(content);
  for (std::string line; std::getline(stream, line);) {
    ASSERT_FALSE(line.empty());
    ASSERT_EQ(line, std::string(line.size(), line[0]));
    EXPECT_EQ(line.size(), ++lines[line[0]] * 97);
  }
  EXPECT_EQ(lines, (std::map<char, std::size_t>{{'a', 100}, {'b', 100}, {'c', 100}, {'d', 100}}));
}

TEST(LogSinksTest, DescriptorThatTakesNothingLosesTheLine) {
  UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
  makeLineLogSink(LogSeverity::debug, full.get())->write(LogSeverity::fault, "lost");
}

TEST(LogSinksTest, JournalStreamIsKnownByDeviceAndInode) {
  const Pipe pipe;
  const Pipe other;
  struct stat status {};
  ASSERT_EQ(::fstat(pipe.writing.get(), &status), 0);
  const std::string name = std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
  EXPECT_TRUE(isJournalStream(name, pipe.writing.get()));
  EXPECT_FALSE(isJournalStream(name, other.writing.get()));
  EXPECT_FALSE(isJournalStream("", pipe.writing.get()));
  EXPECT_FALSE(isJournalStream(name, -1));
}

}  // namespace
}  // namespace storix::linuxhost
