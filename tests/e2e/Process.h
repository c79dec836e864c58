#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "wire/UniqueFd.h"

namespace storix::e2e {

/// How long a test waits for an event before it fails. Generous: sanitizers and busy machines are slow.
inline constexpr std::chrono::seconds deadline{60};

/// A program that a test has started: its output is collected line by line, and it is ended and
/// reaped when the object goes.
class Process {
 public:
  using Environment = std::map<std::string, std::string>;

  /// Starts `arguments[0]` with exactly this environment. stdin is empty. Fails the test when the
  /// program cannot be started.
  Process(std::vector<std::string> arguments, const Environment &environment);
  ~Process();
  Process(const Process &) = delete;
  Process &operator=(const Process &) = delete;

  [[nodiscard]] pid_t processIdentifier() const { return processIdentifier_; }

  void signal(int number) const;

  /// Waits for the end; the exit status, or 128 + the signal's number. Fails the test at the deadline.
  int wait();

  /// Whether it has ended by itself; does not wait.
  [[nodiscard]] bool hasEnded();

  /// Waits until a line of stderr (or of stdout) from index `from` on contains the text, and gives
  /// that line's index; none, and a failed test, when the program ends or the deadline passes first.
  std::optional<std::size_t> waitForLine(const std::string &text, std::size_t from = 0);

  /// All that it has printed by now: what it printed before anything that the test has seen of it is there.
  [[nodiscard]] std::vector<std::string> errorLines();
  [[nodiscard]] std::string output();

  /// The number of those lines of stderr that contain the text.
  [[nodiscard]] std::size_t countLines(const std::string &text);

 private:
  void reap();
  /// What it prints to stdout or stderr.
  struct Printed {
    UniqueFd pipe;
    bool open = false;
    std::string pending;
    std::vector<std::string> lines;
  };
  void collect(Printed &printed);
  static void take(Printed &printed);

  pid_t processIdentifier_ = -1;
  UniqueFd pidfd_;
  std::optional<int> status_;

  std::mutex mutex_;
  std::condition_variable changed_;
  Printed output_;
  Printed errors_;

  std::thread outputReader_;
  std::thread errorReader_;
};

/// Runs a program to its end and gives what it printed and how it ended.
struct Finished {
  int status;
  std::string output;
  std::string errors;
};
Finished run(std::vector<std::string> arguments, const Process::Environment &environment);

}  // namespace storix::e2e
