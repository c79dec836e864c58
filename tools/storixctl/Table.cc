#include "tools/storixctl/Table.h"

#include <algorithm>
#include <cwchar>
#include <utility>

#include "tools/storixctl/Printed.h"

namespace storix::ctl {

namespace {

constexpr std::size_t gap = 2;

}  // namespace

std::size_t columnsOf(const std::string &text) {
  std::size_t columns = 0;
  std::mbstate_t state{};
  for (std::size_t at = 0; at < text.size();) {
    wchar_t character = 0;
    const std::size_t length = std::mbrtowc(&character, text.data() + at, text.size() - at, &state);
    if (length == 0 || length > text.size() - at) {
      state = {};
      ++columns;
      ++at;
      continue;
    }
    columns += static_cast<std::size_t>(std::max(::wcwidth(character), 0));
    at += length;
  }
  return columns;
}

void Table::add(std::vector<std::string> cells) {
  for (std::string &cell : cells) cell = printable(std::move(cell));
  rows_.push_back(std::move(cells));
}

std::string Table::text(bool forTerminal) const {
  std::string text;
  if (!forTerminal) {
    for (const auto &row : rows_) {
      for (std::size_t i = 0; i < row.size(); ++i) text += (i == 0 ? "" : "\t") + row[i];
      text += '\n';
    }
    return text;
  }
  std::vector<std::size_t> widths(header_.size(), 0);
  const auto widen = [&widths](const std::vector<std::string> &row) {
    for (std::size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], columnsOf(row[i]));
  };
  const auto print = [&widths, &text](const std::vector<std::string> &row) {
    std::size_t spaces = 0;
    for (std::size_t i = 0; i < row.size(); ++i) {
      // No spaces at a line's end.
      if (!row[i].empty()) text += std::string(std::exchange(spaces, 0), ' ') + row[i];
      spaces += widths[i] - columnsOf(row[i]) + gap;
    }
    text += '\n';
  };
  widen(header_);
  for (const auto &row : rows_) widen(row);
  print(header_);
  for (const auto &row : rows_) print(row);
  return text;
}

}  // namespace storix::ctl
