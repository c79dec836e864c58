#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "sdk/src/BusLoop.h"
#include "wire/BusConnection.h"

namespace storix::sdk {

/// Waits until the daemon has found its providers. One that has just been started, by the very
/// connection perhaps, gives claims before that, and takes a provider's file for anybody's; but it
/// answers requests only afterwards. Used on the request thread; owned by the claims that wait.
class DaemonStart : public std::enable_shared_from_this<DaemonStart> {
 public:
  /// `loop` must outlive it. An extension's own process never waits: the daemon waits for that one.
  DaemonStart(BusLoop &loop, std::optional<std::string> runtimeDirectory);

  /// Runs the task once the daemon has answered, or cannot be asked; in the order of the calls.
  void then(Task task);

  /// A connection to the daemon was lost: the next may be to another one.
  void forget();

 private:
  enum class State { unknown, asked, over };

  void ask();
  void finish();

  BusLoop &loop_;
  const std::optional<std::string> runtimeDirectory_;
  const bool isExtension_;
  State state_;
  std::shared_ptr<wire::BusConnection> connection_;
  std::vector<Task> waiting_;
};

}  // namespace storix::sdk
