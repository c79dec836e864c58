#include "platform/linux/LogSinks.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <unistd.h>

// The message names its own place; that of this file would say nothing.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

#include <array>
#include <cerrno>
#include <mutex>
#include <string>

namespace storix::linuxhost {

namespace {

constexpr std::string_view programName = "storixd";

class FilteringLogSink : public LogSink {
 public:
  explicit FilteringLogSink(LogSeverity least) : least_(least) {}
  [[nodiscard]] bool isEnabled(LogSeverity severity) const override { return severity >= least_; }

 private:
  LogSeverity least_;
};

int syslogPriority(LogSeverity severity) {
  switch (severity) {
    case LogSeverity::debug:
      return LOG_DEBUG;
    case LogSeverity::info:
      return LOG_INFO;
    case LogSeverity::standard:
      return LOG_NOTICE;
    case LogSeverity::fault:
      return LOG_ERR;
  }
  return LOG_ERR;
}

class JournalLogSink : public FilteringLogSink {
 public:
  using FilteringLogSink::FilteringLogSink;

  void write(LogSeverity severity, std::string_view message) override {
    std::string priority = "PRIORITY=" + std::to_string(syslogPriority(severity));
    std::string identifier = "SYSLOG_IDENTIFIER=" + std::string(programName);
    std::string text = "MESSAGE=" + std::string(message);
    const std::array<iovec, 3> fields{
        {{priority.data(), priority.size()}, {identifier.data(), identifier.size()}, {text.data(), text.size()}}};
    (void)sd_journal_sendv(fields.data(), static_cast<int>(fields.size()));
  }
};

class LineLogSink : public FilteringLogSink {
 public:
  LineLogSink(LogSeverity least, int fd) : FilteringLogSink(least), fd_(fd) {}

  void write(LogSeverity /*severity*/, std::string_view message) override {
    std::string line(message);
    line += '\n';
    std::string_view rest = line;
    // A long line may be taken in pieces; nobody else's may come between them.
    const std::lock_guard lock(mutex_);
    while (!rest.empty()) {
      const ssize_t written = ::write(fd_, rest.data(), rest.size());
      if (written < 0 && errno == EINTR) continue;
      if (written <= 0) return;
      rest.remove_prefix(static_cast<std::size_t>(written));
    }
  }

 private:
  const int fd_;
  std::mutex mutex_;
};

}  // namespace

std::optional<LogSeverity> logSeverityNamed(std::string_view name) {
  if (name == "fault") return LogSeverity::fault;
  if (name == "default") return LogSeverity::standard;
  if (name == "info") return LogSeverity::info;
  if (name == "debug") return LogSeverity::debug;
  return std::nullopt;
}

bool isJournalStream(std::string_view journalStream, int fd) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return false;
  return journalStream == std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
}

std::unique_ptr<LogSink> makeJournalLogSink(LogSeverity least) { return std::make_unique<JournalLogSink>(least); }

std::unique_ptr<LogSink> makeLineLogSink(LogSeverity least, int fd) { return std::make_unique<LineLogSink>(least, fd); }

}  // namespace storix::linuxhost
