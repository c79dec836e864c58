#include "platform/linux/extensions/OutputLines.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <vector>

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class OutputLinesTest : public ::testing::Test {
 protected:
  std::vector<std::string> taken_;
  OutputLines lines_{[this](std::string_view line) { taken_.emplace_back(line); }};
};

TEST_F(OutputLinesTest, LinesAreCutWhereTheyEndAndNotWhereTheyWereRead) {
  lines_.append("on");
  EXPECT_THAT(taken_, IsEmpty());
  lines_.append("e\ntwo\nthr");
  lines_.append("ee\n");
  EXPECT_THAT(taken_, ElementsAre("one", "two", "three"));
}

TEST_F(OutputLinesTest, EmptyLinesAreDropped) {
  lines_.append("\n\na\n\n");
  EXPECT_THAT(taken_, ElementsAre("a"));
}

TEST_F(OutputLinesTest, LastLineNeedsNoEnd) {
  lines_.append("a\nb");
  lines_.finish();
  lines_.finish();
  EXPECT_THAT(taken_, ElementsAre("a", "b"));
}

TEST_F(OutputLinesTest, LongLineIsCutAndTheNextIsWhole) {
  for (int i = 0; i < 3; ++i) lines_.append(std::string(OutputLines::lineLimit, 'x'));
  lines_.append("\nnext\n");
  EXPECT_THAT(taken_, ElementsAre(std::string(OutputLines::lineLimit, 'x') + " [cut]", "next"));
}

TEST_F(OutputLinesTest, LineOfJustTheLimitIsWhole) {
  lines_.append(std::string(OutputLines::lineLimit, 'x'));
  lines_.append("\n");
  EXPECT_THAT(taken_, ElementsAre(std::string(OutputLines::lineLimit, 'x')));
}

}  // namespace
}  // namespace storix::linuxhost
