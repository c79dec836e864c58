#pragma once

#include <memory>
#include <optional>
#include <string>

#include "access/AccessControlMap.h"
#include "access/SXAccessControl.h"
#include "platform/Queue.h"

namespace storix {

/// The persistent list of grants: which provider may provide which of its items to which consumer.
///
/// There is one per process (`sharedStore`), which lives as long as the process. It is thread-safe:
/// every access to the map runs on its serial queue, and the caller waits for it, for the file write
/// too. Nothing is reported to callers: what goes wrong with the file is logged, and the grants in
/// memory stay. On every first-unlock notification the file is read again and wins over memory.
///
/// No function that waits may be called from a task that runs on the store's queue.
class SXAccessControlStore : public SXAccessControl, public std::enable_shared_from_this<SXAccessControlStore> {
 public:
  using Identifier = std::optional<std::string>;

  static std::shared_ptr<SXAccessControlStore> sharedStore();

  /// Observes the first unlock and reads the file. The system has one store: `sharedStore`.
  static std::shared_ptr<SXAccessControlStore> init();

  [[nodiscard]] bool isProviderWithIdentifier(const Identifier &providerID, const Identifier &allowedToProvideItemID,
                                              const Identifier &toConsumerWithIdentifier) override;

  /// The same question, but absent or empty provider and item identifiers are refused unasked.
  [[nodiscard]] bool isProviderIdentifier(const Identifier &providerID, const Identifier &allowedToProvideItemID,
                                          const Identifier &toConsumerWithIdentifier);

  /// Returns when the grant is on the disk or writing it has failed. An absent identifier is a
  /// programming error that ends the process.
  void allowProviderWithIdentifier(const Identifier &providerID, const Identifier &toProvideItemID,
                                   const Identifier &toConsumerWithIdentifier);

  void disallowProviderWithIdentifier(const Identifier &providerID, const Identifier &fromProvidingItemWithID,
                                      const Identifier &toConsumerWithIdentifier);

  /// Reads the file again, later; what is asked after this call sees the outcome.
  void rereadAccessControl();

  /// These two run on the store's queue (or while it is made).
  void syncQueueReadAccessControl();
  void syncQueueCommitAccessControl();

  [[nodiscard]] const std::shared_ptr<SerialQueue> &syncQueue() const { return syncQueue_; }
  void setSyncQueue(std::shared_ptr<SerialQueue> queue) { syncQueue_ = std::move(queue); }

 private:
  SXAccessControlStore();

  [[nodiscard]] bool lookUp(const std::string &providerID, const std::string &itemID, const std::string &consumerID);

  std::shared_ptr<SerialQueue> syncQueue_;
  AccessControlMap syncQueueAccessControlDict_;
};

}  // namespace storix
