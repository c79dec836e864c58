#pragma once

#include <array>
#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

struct LogLine {
  LogSeverity severity;
  std::string text;
  friend bool operator==(const LogLine &, const LogLine &) = default;
};

/// Names the severity as the trace does: "debug", "info", "default", "fault".
std::string_view severityName(LogSeverity severity);

/// Keeps every log line, and enters it in the trace. All severities are on at first. Thread-safe.
class FakeLog : public LogSink {
 public:
  explicit FakeLog(Trace &trace) : trace_(trace) {}

  [[nodiscard]] bool isEnabled(LogSeverity severity) const override;
  void write(LogSeverity severity, std::string_view message) override;

  void setEnabled(LogSeverity severity, bool enabled);
  /// Called with each line as it is written, on the thread that writes it.
  void setObserver(std::function<void(const LogLine &)> observer);
  [[nodiscard]] std::vector<LogLine> lines() const;
  /// The lines so far, which are then forgotten (the trace keeps them).
  std::vector<LogLine> take();
  /// The texts of `lines`, for comparisons that do not care for the severity.
  [[nodiscard]] std::vector<std::string> texts() const;
  [[nodiscard]] bool contains(LogSeverity severity, std::string_view text) const;

 private:
  Trace &trace_;
  std::array<std::atomic<bool>, 4> enabled_{true, true, true, true};
  mutable std::mutex mutex_;
  std::vector<LogLine> lines_;
  std::function<void(const LogLine &)> observer_;
};

}  // namespace storix::fake
