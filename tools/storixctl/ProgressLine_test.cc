#include "tools/storixctl/ProgressLine.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "tools/storixctl/SteppedWaiting.h"
#include "tools/storixctl/Terminal.h"

namespace storix::ctl {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using ::testing::EndsWith;
using ::testing::IsEmpty;

TEST(ProgressLine, NothingAppearsOfWhatTakesAMoment) {
  SteppedWaiting time;
  Terminal terminal;
  {
    ProgressLine line(terminal.descriptor(), "a", time);
    line.show("copying", 1, 2);
    time.advance(milliseconds(499));
    EXPECT_FALSE(line.isDue());
    line.show("copying", 1, 2);
  }
  EXPECT_THAT(terminal.shown(), IsEmpty());
}

TEST(ProgressLine, OneLineIsWrittenOverAndClearedAtTheEnd) {
  SteppedWaiting time;
  Terminal terminal;
  {
    ProgressLine line(terminal.descriptor(), "a", time);
    time.advance(milliseconds(500));
    line.show("copying", 1, 2000);
    EXPECT_EQ(terminal.shown(), "\r\033[Ka: copying, 1 B of 2.0 kB (0 %), 0:00");
    time.advance(milliseconds(99));
    line.show("copying", 999, 2000);
    time.advance(milliseconds(1));
    line.show("copying", 1000, 2000);
    EXPECT_THAT(terminal.shown(), EndsWith("0:00\r\033[Ka: copying, 1.0 kB of 2.0 kB (50 %), 0:00"));
  }
  EXPECT_THAT(terminal.shown(), EndsWith("0:00\r\033[K"));
}

TEST(ProgressLine, WhatIsNotKnownIsLeftOut) {
  SteppedWaiting time;
  Terminal terminal;
  ProgressLine line(terminal.descriptor(), "a", time);
  time.advance(seconds(75));
  line.show("waiting", std::nullopt, std::nullopt);
  EXPECT_THAT(terminal.shown(), EndsWith("a: waiting, 1:15"));
  time.advance(seconds(5));
  line.show("waiting", std::nullopt, 5);
  EXPECT_THAT(terminal.shown(), EndsWith("a: waiting, 5 B, 1:20"));
  time.advance(seconds(1));
  line.show("copying", 5, std::nullopt);
  EXPECT_THAT(terminal.shown(), EndsWith("a: copying, 5 B, 1:21"));
  time.advance(seconds(1));
  line.show("copying", 6, 5);
  EXPECT_THAT(terminal.shown(), EndsWith("a: copying, 6 B of 5 B, 1:22"));
  time.advance(seconds(1));
  line.show("copying", 0, 0);
  EXPECT_THAT(terminal.shown(), EndsWith("a: copying, 0 B of 0 B, 1:23"));
}

TEST(ProgressLine, ALineIsNeverLongerThanTheTerminal) {
  SteppedWaiting time;
  Terminal terminal(12);
  ProgressLine line(terminal.descriptor(), "a\033[2J\xC3\xA9\xC3\xA9\xC3\xA9\xC3\xA9\xC3\xA9\xC3\xA9", time);
  time.advance(seconds(1));
  ASSERT_NE(std::setlocale(LC_CTYPE, "C.UTF-8"), nullptr);
  line.show("waiting", std::nullopt, std::nullopt);
  EXPECT_THAT(terminal.shown(), EndsWith("\r\033[Ka?[2J\xC3\xA9\xC3\xA9\xC3\xA9\xC3\xA9\xC3\xA9\xC3\xA9"));
}

TEST(ProgressLine, WithoutATerminalNothingIsDue) {
  SteppedWaiting time;
  ProgressLine line(-1, "a", time);
  time.advance(seconds(10));
  EXPECT_FALSE(line.isDue());
  line.show("copying", 1, 2);
  line.clear();
}

TEST(ByteCount, AmountsAreShort) {
  EXPECT_EQ(byteCount(0), "0 B");
  EXPECT_EQ(byteCount(999), "999 B");
  EXPECT_EQ(byteCount(1000), "1.0 kB");
  EXPECT_EQ(byteCount(12'345'678), "12.3 MB");
  EXPECT_EQ(byteCount(999'999), "1.0 MB");
  EXPECT_EQ(byteCount(std::numeric_limits<std::uint64_t>::max()), "18.4 EB");
}

}  // namespace
}  // namespace storix::ctl
