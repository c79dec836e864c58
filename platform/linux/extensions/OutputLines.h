#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <string_view>

namespace storix::linuxhost {

/// Cuts what a process writes into lines. Of a line that is too long the beginning is kept. Used by
/// one thread at a time.
class OutputLines {
 public:
  static constexpr std::size_t lineLimit = 2048;

  explicit OutputLines(std::function<void(std::string_view)> takeLine) : takeLine_(std::move(takeLine)) {}

  void append(std::string_view bytes);

  /// The output has ended: what stands without a line end is a line too.
  void finish();

 private:
  void endLine();

  std::function<void(std::string_view)> takeLine_;
  std::string line_;
  bool isCut_ = false;
};

}  // namespace storix::linuxhost
