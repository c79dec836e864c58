#include "platform/fake/FakeExtensionProcess.h"

#include <utility>

namespace storix::fake {

void FakeExtensionProcess::setBeginFailure(std::optional<SXError> error) {
  const std::lock_guard lock(mutex_);
  beginFailure_ = std::move(error);
}

void FakeExtensionProcess::queueBeginFailure(SXError error, std::size_t times) {
  const std::lock_guard lock(mutex_);
  queuedBeginFailures_.insert(queuedBeginFailures_.end(), times, error);
}

void FakeExtensionProcess::setFailedBeginHasIdentifier(bool has) {
  const std::lock_guard lock(mutex_);
  failedBeginHasIdentifier_ = has;
}

void FakeExtensionProcess::setHoldsBegins(bool holds) {
  const std::lock_guard lock(mutex_);
  holdsBegins_ = holds;
}

void FakeExtensionProcess::releaseBegins() {
  std::deque<Task> released;
  {
    const std::lock_guard lock(mutex_);
    released.swap(heldBegins_);
  }
  for (const Task &answer : released) answer();
}

void FakeExtensionProcess::setAnswer(std::string_view operation, VendorAnswer answer) {
  setAnswer(operation, [answer = std::move(answer)](const Arguments &) { return answer; });
}

void FakeExtensionProcess::setAnswer(std::string_view operation, Script script) {
  const std::lock_guard lock(mutex_);
  scripts_.insert_or_assign(std::string(operation), std::move(script));
}

void FakeExtensionProcess::queueAnswer(std::string_view operation, VendorAnswer answer) {
  const std::lock_guard lock(mutex_);
  queuedAnswers_[std::string(operation)].push_back(std::move(answer));
}

std::size_t FakeExtensionProcess::heldAnswerCount() const {
  const std::lock_guard lock(mutex_);
  return heldAnswers_.size();
}

bool FakeExtensionProcess::releaseAnswer() {
  Task answer;
  {
    const std::lock_guard lock(mutex_);
    if (heldAnswers_.empty()) return false;
    answer = std::move(heldAnswers_.front());
    heldAnswers_.pop_front();
  }
  answer();
  return true;
}

void FakeExtensionProcess::releaseAllAnswers() {
  while (releaseAnswer()) {
  }
}

FakeExtensionProcess::BeginOutcome FakeExtensionProcess::nextBegin() {
  const std::lock_guard lock(mutex_);
  if (queuedBeginFailures_.empty()) return {beginFailure_, !beginFailure_ || failedBeginHasIdentifier_};
  SXError error = std::move(queuedBeginFailures_.front());
  queuedBeginFailures_.pop_front();
  return {std::move(error), failedBeginHasIdentifier_};
}

void FakeExtensionProcess::whenBeginsAreReleased(Task answer) {
  {
    const std::lock_guard lock(mutex_);
    if (holdsBegins_) {
      heldBegins_.push_back(std::move(answer));
      return;
    }
  }
  answer();
}

VendorAnswer FakeExtensionProcess::answerFor(std::string_view name, std::string_view method,
                                             const Arguments &arguments) {
  Script script;
  {
    const std::lock_guard lock(mutex_);
    for (const std::string_view known : {name, method}) {
      const auto queued = queuedAnswers_.find(known);
      if (queued == queuedAnswers_.end() || queued->second.empty()) continue;
      VendorAnswer answer = std::move(queued->second.front());
      queued->second.pop_front();
      return answer;
    }
    for (const std::string_view known : {name, method}) {
      const auto found = scripts_.find(known);
      if (found != scripts_.end()) script = found->second;
    }
  }
  return script ? script(arguments) : VendorAnswer::values();
}

void FakeExtensionProcess::hold(Task answer) {
  const std::lock_guard lock(mutex_);
  heldAnswers_.push_back(std::move(answer));
}

void FakeExtensionProcess::clear() {
  std::deque<Task> begins;
  std::deque<Task> answers;
  const std::lock_guard lock(mutex_);
  begins.swap(heldBegins_);
  answers.swap(heldAnswers_);
}

}  // namespace storix::fake
