#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/Result.h"
#include "platform/linux/extensions/ExtensionLauncher.h"
#include "sdk/src/BusLoop.h"

namespace storix::check {

/// The operations of a provider, in the order of the protocol's rows.
enum class Operation : std::size_t {
  performInitialSetup,
  providePlaceholder,
  startProviding,
  itemChanged,
  stopProviding,
  itemIdentifier,
  itemURL,
};

/// The name of the operation's method, "StartProvidingItemAtURL".
std::string_view operationName(Operation operation);

/// What came of one message to an extension.
struct ExtensionAnswer {
  enum class Kind {
    replied,  ///< as the protocol has it
    refused,  ///< with a D-Bus error, or with a reply that does not fit the protocol; `reason` has it
    lost,     ///< the connection ended first
    awaited,  ///< no answer in time
  };
  Kind kind = Kind::awaited;
  std::optional<SXError> error;
  std::optional<std::string> string;
  std::optional<URL> url;
  std::string reason;
};

/// A provider's process, started in the way the daemon starts it, and the daemon's end of its connection.
/// Belongs to one thread. The process is killed and reaped at the latest when the object goes.
class StartedExtension {
 public:
  /// `takeLine` gets what the process prints, on a thread of the object's own. The error says that the
  /// program could not be run, or why it did not log in within ten seconds.
  static Result<std::unique_ptr<StartedExtension>> start(linuxhost::LaunchDescription description,
                                                         std::function<void(std::string_view)> takeLine);
  ~StartedExtension();
  StartedExtension(const StartedExtension &) = delete;
  StartedExtension &operator=(const StartedExtension &) = delete;

  using Pending = std::future<ExtensionAnswer>;
  /// The argument is absent, a URL or an identifier. Ignored by the operation that takes none.
  Pending send(Operation operation, Argument argument);
  /// A message that does not fit the protocol: of a method that it does not have, with an argument of
  /// another type, with a URL that is none.
  enum class Misfit { method, type, url };
  Pending sendMisfit(Misfit misfit);
  static ExtensionAnswer wait(Pending &pending, std::chrono::milliseconds time);

  /// Of the process at this moment; 0 when it cannot be told.
  [[nodiscard]] std::size_t countDescriptors() const;

  /// As the daemon does when nobody needs the extension any more.
  void closeConnection();

  /// How the process has ended: "exited with status 1". None when it is still running after that time.
  std::optional<std::string> waitForEnd(std::chrono::milliseconds time);
  [[nodiscard]] bool endedWell() const { return endedWell_; }

 private:
  explicit StartedExtension(std::function<void(std::string_view)> takeLine);
  std::optional<SXError> launch(linuxhost::LaunchDescription description);
  std::optional<SXError> logIn(UniqueFd socket);
  void readOutput();
  void kill();

  struct Waiting;

  std::function<void(std::string_view)> takeLine_;
  linuxhost::ExtensionLauncher launcher_;
  linuxhost::LaunchedProcess process_;
  std::optional<std::string> ending_;
  bool endedWell_ = false;

  UniqueFd outputStop_;  ///< an eventfd
  std::thread outputThread_;

  sdk::BusLoop loop_;
  std::shared_ptr<wire::BusConnection> connection_;
  std::promise<std::optional<SXError>> login_;
  std::once_flag loginOver_;
  std::thread loopThread_;
};

}  // namespace storix::check
