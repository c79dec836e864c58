#pragma once

#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/AuditToken.h"
#include "platform/Value.h"

namespace storix::fake {

/// Everything that could be observed of the logic, one line each, in order: log lines ("log info
/// [INFO] ..."), calls to the platform with their arguments ("fileExists /home/u") and what the
/// platform gave back later ("answer request-1 ..."). Thread-safe.
class Trace {
 public:
  void add(std::string line);

  [[nodiscard]] std::vector<std::string> lines() const;
  /// The lines so far, which are then forgotten.
  std::vector<std::string> take();

  /// How many lines begin with that text.
  [[nodiscard]] std::size_t count(std::string_view prefix) const;

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
};

/// How arguments stand in the trace: "(file:///a, (null), <token text>)".
std::string traced(const Arguments &arguments);
std::string traced(const std::optional<std::string> &text);
/// "peer 100", or "no peer" for the token that is all zero.
std::string traced(const AuditToken &token);

/// The token of a peer whose process has that number.
AuditToken auditTokenForProcess(std::int32_t processIdentifier);

}  // namespace storix::fake
