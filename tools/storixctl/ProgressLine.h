#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "tools/storixctl/Waiting.h"

namespace storix::ctl {

/// One line on a terminal that tells how far something is, written over as it goes on and cleared at
/// the end. Nothing appears of what takes only a moment, and nothing at all without a terminal.
class ProgressLine {
 public:
  static constexpr std::chrono::milliseconds patience{500};
  static constexpr std::chrono::milliseconds interval{100};

  /// `terminal` is a descriptor, or -1 for none; `subject` what it is about: a document's name.
  ProgressLine(int terminal, std::string subject, Waiting &waiting);
  ~ProgressLine() { clear(); }
  ProgressLine(const ProgressLine &) = delete;
  ProgressLine &operator=(const ProgressLine &) = delete;

  /// Whether `show` would show anything now.
  [[nodiscard]] bool isDue() const { return terminal_ >= 0 && waiting_.now() >= next_; }

  /// What is being done, and how much of how many bytes, as far as that is known.
  void show(const std::string &doing, std::optional<std::uint64_t> done, std::optional<std::uint64_t> size);

  /// Takes the line away; it may come again.
  void clear();

 private:
  const int terminal_;
  const std::string subject_;
  Waiting &waiting_;
  const Waiting::Clock::time_point began_;
  Waiting::Clock::time_point next_;
  bool isShown_ = false;
};

/// "0 B", "999 B", "1.0 kB", "12.3 MB".
std::string byteCount(std::uint64_t bytes);

}  // namespace storix::ctl
