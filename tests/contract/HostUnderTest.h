#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/PlatformServices.h"

namespace storix::contract {

/// An extension bundle as a test of the contract describes it.
struct BundleDescription {
  /// The bundle's name on the host, which no other one has.
  std::string name;
  std::optional<std::string> identifier;
  std::string version = "1";
  std::string extensionPoint = "com.tessel.storix-nonui";
  std::vector<std::string> groups;
  /// Keys of the info dictionary beyond those that the fields above stand for.
  Dictionary info;
};

/// A complete bundle whose name is its identifier.
BundleDescription describedBundle(const std::string &identifier);

/// One implementation of `PlatformServices`, and the means to arrange what is around it. Made anew for
/// each test, on the thread that calls `runEventLoop`.
class HostUnderTest {
 public:
  virtual ~HostUnderTest() = default;

  virtual PlatformServices &platform() = 0;

  /// Ends all that is going on, so that nothing calls into the test any more.
  virtual void shutDown() = 0;

  /// An empty directory for the test's files, as a path without links or "..".
  [[nodiscard]] virtual std::string directory() const = 0;
  virtual void makeDirectory(const std::string &path) = 0;
  /// A file that is no keyed-value text.
  virtual void writeCorruptFile(const std::string &path) = 0;
  virtual void makeSymbolicLink(const std::string &path, const std::string &target) = 0;
  virtual void removeFile(const std::string &path) = 0;

  /// Installs the bundle, or puts it in the place of the one that has this name. Discoveries hear of it.
  virtual void installBundle(const BundleDescription &bundle) = 0;
  virtual void removeBundle(const std::string &name) = 0;

  virtual void setLockState(int state, bool unlockedSinceBoot) = 0;

  virtual void postNotification(const std::string &name) = 0;
  /// Makes `runEventLoop` return, from another thread.
  virtual void endEventLoop() = 0;
};

/// A host to run the contract against.
struct HostKind {
  std::string name;
  std::function<std::unique_ptr<HostUnderTest>()> make;
};

std::vector<HostKind> hostsUnderTest();

std::unique_ptr<HostUnderTest> makeFakeHost();
std::unique_ptr<HostUnderTest> makeLinuxHost();

}  // namespace storix::contract
