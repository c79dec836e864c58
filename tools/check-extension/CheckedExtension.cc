#include "tools/check-extension/CheckedExtension.h"

#include <utility>

namespace storix::check {

namespace {

/// As long as the daemon waits before it sends a signal.
constexpr std::chrono::seconds timeToEnd{5};
/// After so many processes that ended or questions without an answer there is nothing more to be learnt.
constexpr int failuresAtMost = 3;

std::string whatOf(Operation operation, const std::string &subject) {
  return std::string(operationName(operation)) + (subject.empty() ? "" : " for " + subject);
}

}  // namespace

bool CheckedExtension::start() {
  if (process_) return true;
  if (failures_ >= failuresAtMost) return false;
  linuxhost::LaunchDescription description;
  description.executable = setting_.bundle.executable;
  description.workingDirectory = setting_.bundle.bundle->path;
  description.environment = setting_.environment;
  description.prepare = setting_.prepare;
  auto started = StartedExtension::start(std::move(description), setting_.takeOutputLine);
  if (!started) {
    noteFailure("The extension cannot be started: " + started.error().message());
    failures_ = failuresAtMost;
    return false;
  }
  process_ = std::move(started.value());
  return true;
}

void CheckedExtension::noteFailure(std::string sentence) {
  findings_.error(std::move(sentence));
  if (++failures_ == failuresAtMost) {
    findings_.error("The check has ended early, after three processes that ended or questions without an answer.");
  }
}

/// What no provider may do, whatever it was asked.
std::optional<ExtensionAnswer> CheckedExtension::judge(ExtensionAnswer answer, const std::string &what) {
  switch (answer.kind) {
    case ExtensionAnswer::Kind::replied:
      return answer;
    case ExtensionAnswer::Kind::refused:
      if (answer.reason.find("the answer cannot be read") == std::string::npos) return answer;
      findings_.error(what + ": " + answer.reason + ".");
      return std::nullopt;
    case ExtensionAnswer::Kind::awaited:
      noteFailure(what + ": no answer within " +
                  std::to_string(std::chrono::ceil<std::chrono::seconds>(setting_.timeout).count()) + " seconds.");
      return std::nullopt;
    case ExtensionAnswer::Kind::lost:
      break;
  }
  if (!process_) return std::nullopt;  // noted with another of the questions that were under way
  const auto ending = process_->waitForEnd(timeToEnd);
  noteFailure(what + ": the process " + ending.value_or("closed its connection") + " instead of answering.");
  process_.reset();
  start();
  return std::nullopt;
}

std::optional<ExtensionAnswer> CheckedExtension::ask(Operation operation, const Argument &argument,
                                                     const std::string &subject) {
  if (failures_ >= failuresAtMost || !start()) return std::nullopt;
  auto pending = process_->send(operation, argument);
  return judge(StartedExtension::wait(pending, setting_.timeout), whatOf(operation, subject));
}

std::vector<std::optional<ExtensionAnswer>> CheckedExtension::askAtOnce(const std::vector<Question> &questions,
                                                                        const std::string &subject) {
  std::vector<std::optional<ExtensionAnswer>> answers(questions.size());
  if (failures_ >= failuresAtMost || !start()) return answers;
  std::vector<StartedExtension::Pending> pending;
  pending.reserve(questions.size());
  for (const auto &[operation, argument] : questions) pending.push_back(process_->send(operation, argument));
  const auto deadline = std::chrono::steady_clock::now() + setting_.timeout;
  bool failed = false;
  for (std::size_t i = 0; i < pending.size(); ++i) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    auto answer = StartedExtension::wait(pending[i], std::max(left, std::chrono::milliseconds(0)));
    const bool unanswered = answer.kind == ExtensionAnswer::Kind::awaited || answer.kind == ExtensionAnswer::Kind::lost;
    if (failed && unanswered) continue;  // one word about it is enough
    failed = failed || unanswered;
    answers[i] = judge(std::move(answer), whatOf(questions[i].first, subject));
  }
  return answers;
}

std::optional<ExtensionAnswer> CheckedExtension::askMisfit(StartedExtension::Misfit misfit,
                                                           const std::string &subject) {
  if (failures_ >= failuresAtMost || !start()) return std::nullopt;
  auto pending = process_->sendMisfit(misfit);
  return judge(StartedExtension::wait(pending, setting_.timeout), subject);
}

void CheckedExtension::end(bool underWay) {
  if (!process_) return;
  const std::string when =
      underWay ? "When the connection is closed while a document is being provided" : "When the connection is closed";
  process_->closeConnection();
  const auto ending = process_->waitForEnd(timeToEnd);
  if (!ending) {
    const std::string sentence = when + ", the process goes on for more than 5 seconds; the daemon ends it by a signal";
    if (underWay) {
      findings_.advice(sentence + ", and what it was doing is lost. Have long work end with the connection.");
    } else {
      findings_.error(sentence + ".");
    }
  } else if (!process_->endedWell()) {
    findings_.error(when + ", the process " + *ending + "; it should exit with status 0.");
  }
  process_.reset();
}

void CheckedExtension::endWhile(Operation operation, const Argument &argument) {
  if (failures_ >= failuresAtMost || !start()) return;
  const auto ignored = process_->send(operation, argument);
  end(true);
}

std::optional<std::string> failureOf(const ExtensionAnswer &answer) {
  if (answer.kind != ExtensionAnswer::Kind::replied) return answer.reason;
  if (answer.error) return answer.error->message();
  return std::nullopt;
}

}  // namespace storix::check
