#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "access/SXAccessControl.h"
#include "platform/Extensions.h"
#include "platform/OnceToken.h"
#include "platform/Queue.h"

namespace storix {

class SXExtensionStorix;

/// The class side of `SXExtensionStorix`: which provider extensions are installed, one object each.
///
/// One per process, reached through the static functions of `SXExtensionStorix`, made on first use.
/// Every delivery of the complete list of extensions starts one refresh: the map is rewritten, what
/// is new is registered with the file coordination service, one provider at a time, and what is gone
/// is withdrawn. Refreshes follow one another end to end: their queue stays suspended while one runs.
///
/// Thread-safe; lookups run side by side and never see a half-rewritten map. Nothing is reported to
/// callers: a lookup that fails answers none. No lookup may be made from a task on the registry queue.
class ProviderRegistry : public std::enable_shared_from_this<ProviderRegistry> {
 public:
  using Provider = std::shared_ptr<SXExtensionStorix>;

  static std::shared_ptr<ProviderRegistry> shared();

  ProviderRegistry();

  /// The first call starts discovery, for ever, and its completion runs when the first refresh has
  /// ended; that of a later call runs soon, on the global queue.
  void createInstancesCompletion(std::function<void()> completion);

  /// Registers one after another, in order; the completion runs on the global queue.
  void refreshOperationsQueueRegisterProviders(const std::vector<Provider> &providers,
                                               std::function<void()> completion);

  void setStorixAccessControl(const std::shared_ptr<SXAccessControl> &accessControl);

  Provider providerForURL(const std::optional<URL> &url, bool *outExcludedURL);
  Dictionary providersInfo();
  Provider providerWithIdentifier(const std::optional<std::string> &identifier);

 private:
  using Records = std::vector<std::shared_ptr<ExtensionRecord>>;

  // A refresh, step by step.
  void extensionsChanged(Records records);
  void beginRefresh(Records records);
  void rewriteProviderMap(const Records &records);
  void endRefresh();

  std::shared_ptr<SerialQueue> refreshOperationsQueue_;
  std::shared_ptr<ConcurrentQueue> registryQueue_;

  // Rewritten by a barrier task on the registry queue, read by plain ones.
  std::map<std::string, Provider, std::less<>> providers_;

  OnceToken startUp_;
  // Written by the start-up, taken by the end of the first refresh.
  std::function<void()> pendingStartUpCompletion_;
  std::shared_ptr<ExtensionMatching> discoveryHandle_;

  // Nobody sets it and nobody reads it: the servicers reach the store through the server.
  std::weak_ptr<SXAccessControl> accessControl_;
};

}  // namespace storix
