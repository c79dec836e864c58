#pragma once

#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Executor.h"
#include "platform/SXError.h"
#include "platform/Value.h"

namespace storix::fake {

/// What an extension does with one message.
struct VendorAnswer {
  /// The reply's values; none when the message is never answered.
  std::optional<Arguments> reply;
  /// A failure of the connection that is reported for the message, after the reply where there is one.
  std::optional<SXError> failure;
  /// Waits until the test releases it.
  bool isHeld = false;

  static VendorAnswer values(Arguments values = {}) { return {std::move(values), std::nullopt, false}; }
  static VendorAnswer never() { return {}; }
  static VendorAnswer connectionFailure(SXError error) { return {std::nullopt, std::move(error), false}; }
  static VendorAnswer valuesThenConnectionFailure(Arguments values, SXError error) {
    return {std::move(values), std::move(error), false};
  }
  VendorAnswer held() && {
    isHeld = true;
    return std::move(*this);
  }
};

/// The script of one extension: how its requests begin and what it answers. At first every request
/// begins, and every message is answered with all values absent. Operations go by their names
/// ("_startProvidingItemAtURL:completion:") or methods ("StartProvidingItemAtURL"). Thread-safe.
class FakeExtensionProcess {
 public:
  using Script = std::function<VendorAnswer(const Arguments &arguments)>;

  // --- Beginning a request

  /// Every begin fails with it from now on; none lets them succeed again.
  void setBeginFailure(std::optional<SXError> error);
  /// The next begins that nothing else was queued for fail with it.
  void queueBeginFailure(SXError error, std::size_t times = 1);
  /// Whether a begin that fails gives the identifier of the failed request; it does at first.
  void setFailedBeginHasIdentifier(bool has);
  /// Begins are not answered until they are released.
  void setHoldsBegins(bool holds);
  /// Answers the begins that wait, in order, and goes on holding new ones.
  void releaseBegins();

  // --- Messages

  void setAnswer(std::string_view operation, VendorAnswer answer);
  void setAnswer(std::string_view operation, Script script);
  /// Used once, before what `setAnswer` says.
  void queueAnswer(std::string_view operation, VendorAnswer answer);

  [[nodiscard]] std::size_t heldAnswerCount() const;
  /// Gives the answer that was held longest; false when there is none.
  bool releaseAnswer();
  void releaseAllAnswers();

 private:
  friend class FakeExtensions;

  struct BeginOutcome {
    std::optional<SXError> error;
    bool hasIdentifier = true;
  };
  BeginOutcome nextBegin();
  /// Runs `answer` now, or when the test releases it.
  void whenBeginsAreReleased(Task answer);
  VendorAnswer answerFor(std::string_view name, std::string_view method, const Arguments &arguments);
  void hold(Task answer);
  /// Forgets what is held.
  void clear();

  mutable std::mutex mutex_;
  std::optional<SXError> beginFailure_;
  std::deque<SXError> queuedBeginFailures_;
  bool failedBeginHasIdentifier_ = true;
  bool holdsBegins_ = false;
  std::deque<Task> heldBegins_;
  std::map<std::string, Script, std::less<>> scripts_;
  std::map<std::string, std::deque<VendorAnswer>, std::less<>> queuedAnswers_;
  std::deque<Task> heldAnswers_;
};

}  // namespace storix::fake
