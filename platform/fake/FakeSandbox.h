#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "platform/PlatformServices.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

/// Who may write what, and which tokens can be issued, as a test says. Thread-safe.
class FakeSandbox {
 public:
  explicit FakeSandbox(Trace &trace) : trace_(trace) {}

  /// Answers 0 from now on for this peer and path. Whatever was not allowed is answered with 1.
  void allowAccess(const AuditToken &token, const std::string &path);
  void setAccessAnswer(const AuditToken &token, const std::string &path, int answer);
  void failExtension(const std::string &path, bool fails = true);

  /// The token that is issued for the path.
  static std::string tokenFor(const std::string &path) { return "token readWrite " + path; }

  // --- The platform's operations
  int checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                         const std::string &path);
  std::optional<std::string> issueSandboxExtension(SandboxExtensionClass extensionClass, const std::string &path,
                                                   std::uint32_t flags);

 private:
  Trace &trace_;
  std::mutex mutex_;
  std::map<std::pair<std::array<std::uint32_t, 8>, std::string>, int> answers_;
  std::set<std::string> failing_;
};

}  // namespace storix::fake
