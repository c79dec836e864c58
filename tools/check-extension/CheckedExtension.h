#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "tools/check-extension/CheckBundle.h"
#include "tools/check-extension/Findings.h"
#include "tools/check-extension/StartedExtension.h"

namespace storix::check {

/// The extension that a check is about: asks it, notes in the findings what no provider may do, whatever
/// it is asked, and starts it again when it has ended. Belongs to one thread.
class CheckedExtension {
 public:
  struct Setting {
    CheckedBundle bundle;
    std::vector<std::string> environment;
    /// As of `LaunchDescription`; empty where nothing is to be changed.
    std::function<std::optional<SXError>(linuxhost::LaunchDescription &)> prepare;
    std::chrono::milliseconds timeout{};
    std::function<void(std::string_view)> takeOutputLine;
  };

  CheckedExtension(Setting setting, Findings &findings) : setting_(std::move(setting)), findings_(findings) {}

  /// False when no process could be started, now or before; the findings say why.
  bool start();

  /// Asks for one thing and waits. `subject` is what the sentences call it: "a URL outside". None when
  /// there was no answer, or one that cannot be read: both are findings.
  std::optional<ExtensionAnswer> ask(Operation operation, const Argument &argument, const std::string &subject);

  /// The same for many things at the same time; the answers in the order of the questions.
  using Question = std::pair<Operation, Argument>;
  std::vector<std::optional<ExtensionAnswer>> askAtOnce(const std::vector<Question> &questions,
                                                        const std::string &subject);

  std::optional<ExtensionAnswer> askMisfit(StartedExtension::Misfit misfit, const std::string &subject);

  /// Closes the connection, as the daemon does, and looks how the process ends. With something `underWay`
  /// that takes long is no error.
  void end(bool underWay);

  /// Asks, does not wait, and ends it.
  void endWhile(Operation operation, const Argument &argument);

  [[nodiscard]] std::size_t countDescriptors() const { return process_ ? process_->countDescriptors() : 0; }
  [[nodiscard]] Findings &findings() { return findings_; }

 private:
  std::optional<ExtensionAnswer> judge(ExtensionAnswer answer, const std::string &what);
  void noteFailure(std::string sentence);

  const Setting setting_;
  Findings &findings_;
  std::unique_ptr<StartedExtension> process_;
  int failures_ = 0;
};

/// What an answer says went wrong, in words; none for success.
std::optional<std::string> failureOf(const ExtensionAnswer &answer);

}  // namespace storix::check
