#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "wire/SdBus.h"

namespace storix::bench {

/// A client on sd-bus alone, the same for the daemon and for what it is compared with. Used by one
/// thread at a time. What fails ends the benchmark.
class BusClient {
 public:
  /// Of the daemon, or of a program that answers as it does.
  explicit BusClient(const std::string &socket);

  /// Calls a method of `com.tessel.Storix.Daemon`, each argument present. The reply must carry no error.
  void call(const char *method, const std::vector<std::string> &arguments = {});
  /// The same, and gives the first string of the reply.
  std::string callForText(const char *method, const std::vector<std::string> &arguments);

  /// A claim of `com.tessel.Platform.FileCoordination`.
  std::uint64_t beginRead(const std::string &url);
  void endRead(std::uint64_t claim);

 private:
  wire::OwnedMessage request(const char *method, const std::vector<std::string> &arguments);
  wire::OwnedMessage exchange(const char *method, const wire::OwnedMessage &message);

  wire::OwnedBus bus_;
};

}  // namespace storix::bench
