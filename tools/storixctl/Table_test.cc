#include "tools/storixctl/Table.h"

#include <gtest/gtest.h>

#include <clocale>

namespace storix::ctl {
namespace {

Table sample() {
  Table table({"A", "LONGER", "C"});
  table.add({"one", "2", "x y"});
  table.add({"o", "", ""});
  return table;
}

TEST(Table, OnATerminalColumnsStandBelowAHeader) {
  EXPECT_EQ(sample().text(true),
            "A    LONGER  C\n"
            "one  2       x y\n"
            "o\n");
}

TEST(Table, ElsewhereTabsStandBetweenCells) { EXPECT_EQ(sample().text(false), "one\t2\tx y\no\t\t\n"); }

TEST(Table, ATableWithoutRowsIsItsHeader) {
  EXPECT_EQ(Table({"A", "B"}).text(true), "A  B\n");
  EXPECT_EQ(Table({"A", "B"}).text(false), "");
}

TEST(Table, CellsCannotBreakLinesOrCommandTheTerminal) {
  Table table({"A", "B"});
  table.add({"a\tb\n", "\033[2J"});
  EXPECT_EQ(table.text(false), "a?b?\t?[2J\n");
}

TEST(Table, WideAndCombinedLettersTakeTheirColumns) {
  ASSERT_NE(std::setlocale(LC_CTYPE, "C.UTF-8"), nullptr);
  EXPECT_EQ(columnsOf("caf\xC3\xA9"), 4U);
  EXPECT_EQ(columnsOf("cafe\xCC\x81"), 4U);
  EXPECT_EQ(columnsOf("\xE6\x96\x87"), 2U);
  EXPECT_EQ(columnsOf("a\xFFz\xC3"), 4U);
  EXPECT_EQ(columnsOf(std::string("a\0b", 3)), 3U);
  Table table({"A", "B"});
  table.add({"\xE6\x96\x87", "x"});
  table.add({"abc", "y"});
  EXPECT_EQ(table.text(true), "A    B\n\xE6\x96\x87   x\nabc  y\n");
}

}  // namespace
}  // namespace storix::ctl
