#include "platform/fake/FakeLog.h"

#include <algorithm>
#include <utility>

namespace storix::fake {

std::string_view severityName(LogSeverity severity) {
  switch (severity) {
    case LogSeverity::debug:
      return "debug";
    case LogSeverity::info:
      return "info";
    case LogSeverity::standard:
      return "default";
    case LogSeverity::fault:
      return "fault";
  }
  return "unknown";
}

bool FakeLog::isEnabled(LogSeverity severity) const { return enabled_[static_cast<std::size_t>(severity)]; }

void FakeLog::write(LogSeverity severity, std::string_view message) {
  LogLine line{severity, std::string(message)};
  std::function<void(const LogLine &)> observer;
  {
    const std::lock_guard lock(mutex_);
    lines_.push_back(line);
    trace_.add("log " + std::string(severityName(severity)) + " " + line.text);
    observer = observer_;
  }
  if (observer) observer(line);
}

void FakeLog::setObserver(std::function<void(const LogLine &)> observer) {
  const std::lock_guard lock(mutex_);
  observer_ = std::move(observer);
}

void FakeLog::setEnabled(LogSeverity severity, bool enabled) { enabled_[static_cast<std::size_t>(severity)] = enabled; }

std::vector<LogLine> FakeLog::lines() const {
  const std::lock_guard lock(mutex_);
  return lines_;
}

std::vector<LogLine> FakeLog::take() {
  const std::lock_guard lock(mutex_);
  return std::exchange(lines_, {});
}

std::vector<std::string> FakeLog::texts() const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  texts.reserve(lines_.size());
  for (const LogLine &line : lines_) texts.push_back(line.text);
  return texts;
}

bool FakeLog::contains(LogSeverity severity, std::string_view text) const {
  const std::lock_guard lock(mutex_);
  return std::any_of(lines_.begin(), lines_.end(),
                     [&](const LogLine &line) { return line.severity == severity && line.text == text; });
}

}  // namespace storix::fake
