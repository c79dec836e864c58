#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/FileCoordination.h"
#include "platform/fake/FakeThreads.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

/// The file coordination service, with the reads and writes of other processes played by the test.
/// Providers are asked on their own operation queues. Thread-safe.
class FakeFileCoordination : public FileCoordinationService {
 public:
  explicit FakeFileCoordination(Trace &trace) : trace_(trace) {}

  void addProvider(std::shared_ptr<KTStorix> provider) override;
  void removeProvider(const std::shared_ptr<KTStorix> &provider) override;

  /// In the order in which they were added; one that was added twice stands here twice.
  [[nodiscard]] std::vector<std::shared_ptr<KTStorix>> providers() const;

  // Each of these is about the first provider whose directory holds the URL; false when there is
  // none, or when it does not answer such a callback.

  /// A coordinated read. The completion gets the provider's first answer; further ones are traced.
  bool read(const URL &url, std::optional<std::string> readerID, KTStorix::Completion completion);
  /// The same through the callback that names no reader.
  bool readWithoutReader(const URL &url, KTStorix::Completion completion);
  bool cancelRead(const URL &url, std::optional<std::string> readerID);
  bool finishWriting(const URL &url, std::optional<std::string> writerID);
  bool gainPresenter(const URL &url, std::optional<std::string> presenterID);
  bool losePresenter(const URL &url, std::optional<std::string> presenterID);
  bool movePresented(const URL &url, std::optional<std::string> presenterID, const URL &newURL);

  /// Lets go of every provider.
  void clear();

 private:
  using Question = std::function<void(KTStorix &provider)>;

  [[nodiscard]] std::shared_ptr<KTStorix> providerFor(const URL &url) const;
  [[nodiscard]] bool isRegistered(const std::shared_ptr<KTStorix> &provider) const;
  /// Asks the provider on its operation queue, unless it has been withdrawn by then.
  void ask(const std::shared_ptr<KTStorix> &provider, Question question);
  KTStorix::Completion tracedOnce(const URL &url, KTStorix::Completion completion);

  Trace &trace_;
  mutable std::mutex mutex_;
  std::vector<std::shared_ptr<KTStorix>> providers_;
};

}  // namespace storix::fake
