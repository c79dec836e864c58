#include "platform/fake/FakeSandbox.h"

namespace storix::fake {
namespace {

constexpr int refused = 1;

std::string filterName(SandboxFilter filter) {
  switch (filter) {
    case SandboxFilter::path:
      return "path";
    case SandboxFilter::noReport:
      return "noReport";
    case SandboxFilter::pathNoReport:
      return "pathNoReport";
  }
  return "filter " + std::to_string(static_cast<unsigned>(filter));
}

}  // namespace

void FakeSandbox::allowAccess(const AuditToken &token, const std::string &path) { setAccessAnswer(token, path, 0); }

void FakeSandbox::setAccessAnswer(const AuditToken &token, const std::string &path, int answer) {
  const std::lock_guard lock(mutex_);
  answers_.insert_or_assign({token.words, path}, answer);
}

void FakeSandbox::failExtension(const std::string &path, bool fails) {
  const std::lock_guard lock(mutex_);
  if (fails) {
    failing_.insert(path);
  } else {
    failing_.erase(path);
  }
}

int FakeSandbox::checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                                    const std::string &path) {
  trace_.add("checkSandboxAccess " + traced(token) + " " + std::string(operation) + " " + filterName(filter) + " " +
             path);
  const std::lock_guard lock(mutex_);
  const auto found = answers_.find({token.words, path});
  return found == answers_.end() ? refused : found->second;
}

std::optional<std::string> FakeSandbox::issueSandboxExtension(SandboxExtensionClass extensionClass,
                                                              const std::string &path, std::uint32_t flags) {
  const std::string className = extensionClass == SandboxExtensionClass::readWrite ? "readWrite" : "unknown";
  trace_.add("issueSandboxExtension " + className + " " + path + " flags=" + std::to_string(flags));
  const std::lock_guard lock(mutex_);
  if (failing_.contains(path)) return std::nullopt;
  return tokenFor(path);
}

}  // namespace storix::fake
