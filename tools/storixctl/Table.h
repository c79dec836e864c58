#pragma once

#include <string>
#include <vector>

namespace storix::ctl {

/// Rows of texts. On a terminal they stand in columns below a header; elsewhere there is a line for each
/// row with tabs between its cells, and no header, so that other programs read it.
class Table {
 public:
  explicit Table(std::vector<std::string> header) : header_(std::move(header)) {}

  /// As many cells as the header has. Control characters in them become "?".
  void add(std::vector<std::string> cells);

  [[nodiscard]] std::string text(bool forTerminal) const;

 private:
  std::vector<std::string> header_;
  std::vector<std::vector<std::string>> rows_;
};

/// The columns of a terminal that a text takes, in the process's locale; what is no text there counts
/// one column a byte.
std::size_t columnsOf(const std::string &text);

}  // namespace storix::ctl
