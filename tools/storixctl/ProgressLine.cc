#include "tools/storixctl/ProgressLine.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <string_view>
#include <utility>

#include "tools/storixctl/Printed.h"
#include "tools/storixctl/Table.h"

namespace storix::ctl {

namespace {

constexpr std::string_view clearLine = "\r\033[K";

std::size_t widthOf(int terminal) {
  winsize size{};
  return ::ioctl(terminal, TIOCGWINSZ, &size) == 0 && size.ws_col > 0 ? size.ws_col : 80;
}

/// As much of the text's beginning as fits, whole characters.
std::string fitting(const std::string &text, std::size_t columns) {
  std::string fit;
  for (const char byte : text) {
    const bool beginsCharacter = (byte & 0xC0) != 0x80;
    if (beginsCharacter && columnsOf(fit) >= columns) break;
    fit += byte;
  }
  while (columnsOf(fit) > columns) fit.pop_back();
  return fit;
}

void write(int terminal, std::string_view text) {
  // Only for the eye: what the terminal does not take is left out.
  (void)!::write(terminal, text.data(), text.size());
}

std::string elapsed(Waiting::Clock::duration time) {
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(time).count();
  const std::string rest = std::to_string(seconds % 60);
  return std::to_string(seconds / 60) + ":" + (rest.size() < 2 ? "0" : "") + rest;
}

}  // namespace

std::string byteCount(std::uint64_t bytes) {
  constexpr std::array<const char *, 7> units{"B", "kB", "MB", "GB", "TB", "PB", "EB"};
  if (bytes < 1000) return std::to_string(bytes) + " B";
  auto amount = static_cast<double>(bytes);
  std::size_t unit = 0;
  for (; amount >= 999.95 && unit + 1 < units.size(); ++unit) amount /= 1000;
  std::array<char, 32> text{};
  (void)std::snprintf(text.data(), text.size(), "%.1f %s", amount, units[unit]);
  return text.data();
}

ProgressLine::ProgressLine(int terminal, std::string subject, Waiting &waiting)
    : terminal_(terminal),
      subject_(printable(std::move(subject))),
      waiting_(waiting),
      began_(waiting.now()),
      next_(began_ + patience) {}

void ProgressLine::show(const std::string &doing, std::optional<std::uint64_t> done,
                        std::optional<std::uint64_t> size) {
  if (!isDue()) return;
  const auto now = waiting_.now();
  next_ = now + interval;
  std::string text = subject_ + ": " + doing;
  if (done) text += ", " + byteCount(*done);
  if (size) text += (done ? " of " : ", ") + byteCount(*size);
  if (done && size && *size > 0 && *done <= *size) {
    const double share = static_cast<double>(*done) / static_cast<double>(*size);
    text += " (" + std::to_string(static_cast<int>(100 * share)) + " %)";
  }
  text += ", " + elapsed(now - began_);
  write(terminal_, std::string(clearLine) + fitting(text, widthOf(terminal_) - 1));
  isShown_ = true;
}

void ProgressLine::clear() {
  if (std::exchange(isShown_, false)) write(terminal_, clearLine);
}

}  // namespace storix::ctl
