#include "platform/fake/FakeTrace.h"

#include <algorithm>
#include <utility>

#include "platform/Log.h"

namespace storix::fake {
namespace {

// Which word of a made-up token holds the process identifier.
constexpr std::size_t processWord = 5;

}  // namespace

void Trace::add(std::string line) {
  const std::lock_guard lock(mutex_);
  lines_.push_back(std::move(line));
}

std::vector<std::string> Trace::lines() const {
  const std::lock_guard lock(mutex_);
  return lines_;
}

std::vector<std::string> Trace::take() {
  const std::lock_guard lock(mutex_);
  return std::exchange(lines_, {});
}

std::size_t Trace::count(std::string_view prefix) const {
  const std::lock_guard lock(mutex_);
  return static_cast<std::size_t>(std::count_if(
      lines_.begin(), lines_.end(), [prefix](const std::string &line) { return line.starts_with(prefix); }));
}

std::string traced(const Arguments &arguments) {
  std::string text = "(";
  for (const Argument &argument : arguments) {
    if (text.size() > 1) text += ", ";
    const Data *data = argument ? argument->data() : nullptr;
    text += data ? "<" + escapedForLog(data->bytes) + ">" : escapedForLog(logDescription(argument));
  }
  return text + ")";
}

std::string traced(const std::optional<std::string> &text) { return escapedForLog(logDescription(text)); }

std::string traced(const AuditToken &token) {
  if (token == AuditToken{}) return "no peer";
  return "peer " + std::to_string(static_cast<std::int32_t>(token.words[processWord]));
}

AuditToken auditTokenForProcess(std::int32_t processIdentifier) {
  AuditToken token;
  token.words[processWord] = static_cast<std::uint32_t>(processIdentifier);
  return token;
}

}  // namespace storix::fake
