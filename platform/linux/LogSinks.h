#pragma once

#include <memory>
#include <optional>
#include <string_view>

#include "platform/Log.h"

namespace storix::linuxhost {

/// The least severity that a value of STORIX_LOG ("fault", "default", "info", "debug") lets through;
/// none for any other text.
std::optional<LogSeverity> logSeverityNamed(std::string_view name);

/// Whether the descriptor is the stream that the service manager connected to the journal.
/// `journalStream` is the value of JOURNAL_STREAM: "<device>:<inode>".
bool isJournalStream(std::string_view journalStream, int fd);

/// Writes to the journal, with fields. Thread-safe.
std::unique_ptr<LogSink> makeJournalLogSink(LogSeverity least);

/// Writes lines to the descriptor, each with one call, so that they never mix. The descriptor is
/// borrowed. A line that it does not take is lost. Thread-safe.
std::unique_ptr<LogSink> makeLineLogSink(LogSeverity least, int fd);

}  // namespace storix::linuxhost
