#include "platform/linux/extensions/ExtensionDiscovery.h"

#include <sys/epoll.h>

#include <algorithm>
#include <chrono>
#include <mutex>

#include "platform/Log.h"
#include "platform/Queue.h"
#include "platform/linux/extensions/DirectoryWatches.h"

namespace storix::linuxhost {

namespace {

/// A burst of changes is over when nothing has changed for this long, and is not waited out for ever.
constexpr std::chrono::milliseconds quietTime{100};
constexpr int quietTimesAtMost = 20;
constexpr std::chrono::seconds timeBetweenTries{1};

struct FoundExtension {
  std::shared_ptr<const ExtensionBundle> bundle;
  std::shared_ptr<ExtensionRecord> record;
};

using RecordList = std::vector<std::shared_ptr<ExtensionRecord>>;

class Matching : public ExtensionMatching {
 public:
  Matching(std::optional<std::string> extensionPoint, ExtensionMatchingHandler handler)
      : extensionPoint_(std::move(extensionPoint)), handler_(std::move(handler)) {}

  /// Calls the handler unless it knows this list already; makes the group containers of what it does
  /// not know. On the discovery's queue.
  void deliver(const ExtensionPlaces &places, const std::vector<FoundExtension> &found,
               const std::optional<SXError> &error) {
    RecordList records;
    for (const FoundExtension &extension : found) {
      if (!extensionPoint_ || extension.bundle->extensionPoint != *extensionPoint_) continue;
      records.push_back(extension.record);
      if (!knows(extension.record)) makeContainers(places, *extension.bundle);
    }
    if (delivered_ && *delivered_ == records) return;
    delivered_ = records;
    if (handler_) handler_(std::move(records), error);
  }

 private:
  [[nodiscard]] bool knows(const std::shared_ptr<ExtensionRecord> &record) const {
    return delivered_ && std::find(delivered_->begin(), delivered_->end(), record) != delivered_->end();
  }

  static void makeContainers(const ExtensionPlaces &places, const ExtensionBundle &bundle) {
    for (const BundleProblem &problem : makeGroupContainers(places, bundle)) {
      sx_default_log().fault("[ERROR] Could not make the group container %@ of %@. Error: %@", problem.path,
                             bundle.path, problem.error);
    }
  }

  const std::optional<std::string> extensionPoint_;
  const ExtensionMatchingHandler handler_;
  std::optional<RecordList> delivered_;
};

}  // namespace

struct ExtensionDiscovery::Implementation : std::enable_shared_from_this<Implementation>, DirectoryReadingObserver {
  Implementation(ExtensionPlaces initialPlaces, Executor &initialExecutor, RecordFactory initialMakeRecord)
      : places(std::move(initialPlaces)),
        executor(initialExecutor),
        makeRecord(std::move(initialMakeRecord)),
        queue(SerialQueue::create(initialExecutor, "extension discovery")) {}

  void willReadExtensionDirectory(const std::string &path) override {
    const std::lock_guard lock(watchesMutex);
    watches.watch(path, "*" + std::string(bundleSuffix));
  }

  void willReadBundle(const std::string &path) override {
    const std::lock_guard lock(watchesMutex);
    watches.watch(path, std::string(infoFileName));
  }

  void changesAreReadable() {
    {
      const std::lock_guard lock(watchesMutex);
      if (!watches.readChanges()) return;
    }
    const std::lock_guard lock(mutex);
    ++changes;
    if (lookIsDue) return;
    lookIsDue = true;
    lookWhenQuiet(changes, quietTimesAtMost);
  }

  void lookWhenQuiet(std::uint64_t changesSoFar, int quietTimesLeft) {
    executor.executeAfter(quietTime, [weak = weak_from_this(), changesSoFar, quietTimesLeft] {
      const std::shared_ptr<Implementation> self = weak.lock();
      if (!self) return;
      {
        const std::lock_guard lock(self->mutex);
        if (self->changes != changesSoFar && quietTimesLeft > 1) {
          self->lookWhenQuiet(self->changes, quietTimesLeft - 1);
          return;
        }
        self->lookIsDue = false;
      }
      self->queue->async([weak] {
        if (const std::shared_ptr<Implementation> looking = weak.lock()) looking->lookAndDeliver();
      });
    });
  }

  void lookAndDeliver() {
    look();
    deliver();
  }

  /// On the queue: reads all directories and settles which records there are.
  void look() {
    {
      const std::lock_guard lock(watchesMutex);
      watches.beginRound();
    }
    const BundleScan scan = scanExtensionBundles(places, *this);
    std::vector<BundleProblem> problems = scan.bundleProblems;
    problems.insert(problems.end(), scan.directoryProblems.begin(), scan.directoryProblems.end());
    {
      const std::lock_guard lock(watchesMutex);
      for (SXError &unwatched : watches.endRound()) problems.push_back({std::string(), std::move(unwatched)});
    }
    const bool tryAgain = std::any_of(problems.begin(), problems.end(),
                                      [](const BundleProblem &problem) { return problem.isTransient(); });
    std::vector<FoundExtension> nowFound;
    for (const std::shared_ptr<const ExtensionBundle> &bundle : scan.bundles) {
      const auto known = std::find_if(found.begin(), found.end(), [&bundle](const FoundExtension &extension) {
        return *extension.bundle == *bundle;
      });
      if (known != found.end()) {
        nowFound.push_back(*known);
        continue;
      }
      nowFound.push_back({bundle, makeRecord(bundle)});
    }
    logNews(problems);
    if (tryAgain) {
      executor.executeAfter(timeBetweenTries, [weak = weak_from_this()] {
        const std::shared_ptr<Implementation> self = weak.lock();
        if (self)
          self->queue->async([weak] {
            if (const auto looking = weak.lock()) looking->lookAndDeliver();
          });
      });
      if (hasLooked) return;
    }
    const std::lock_guard lock(mutex);
    found.swap(nowFound);
    error.reset();
    if (!scan.directoryProblems.empty()) error = scan.directoryProblems.front().error;
    hasLooked = true;
  }

  void logNews(std::vector<BundleProblem> problems) {
    for (const BundleProblem &problem : problems) {
      if (std::find(knownProblems.begin(), knownProblems.end(), problem) != knownProblems.end()) continue;
      if (problem.path.empty()) {
        sx_default_log().fault("[ERROR] Extensions will not be found anew when they change. Error: %@", problem.error);
      } else {
        sx_default_log().fault("[ERROR] Could not use %@. Error: %@", problem.path, problem.error);
      }
    }
    knownProblems = std::move(problems);
  }

  /// On the queue.
  void deliver() {
    std::vector<std::shared_ptr<Matching>> current;
    for (const std::weak_ptr<Matching> &weak : matchings) {
      if (std::shared_ptr<Matching> matching = weak.lock()) current.push_back(std::move(matching));
    }
    std::erase_if(matchings, [](const std::weak_ptr<Matching> &weak) { return weak.expired(); });
    for (std::shared_ptr<Matching> &matching : current) {
      matching->deliver(places, found, error);
      matching.reset();
    }
  }

  const ExtensionPlaces places;
  Executor &executor;
  const RecordFactory makeRecord;
  const std::shared_ptr<SerialQueue> queue;

  std::mutex watchesMutex;
  DirectoryWatches watches;

  // Written on the queue under the mutex; read on the queue, or under the mutex.
  std::mutex mutex;
  std::vector<FoundExtension> found;
  std::optional<SXError> error;
  bool hasLooked = false;

  // Under the mutex.
  std::uint64_t changes = 0;
  bool lookIsDue = false;

  // On the queue.
  std::vector<std::weak_ptr<Matching>> matchings;
  std::vector<BundleProblem> knownProblems;

  std::unique_ptr<IoLoop::Watch> watch;
};

ExtensionDiscovery::ExtensionDiscovery(ExtensionPlaces places, Executor &executor, IoLoop &loop,
                                       RecordFactory makeRecord)
    : implementation_(std::make_shared<Implementation>(std::move(places), executor, std::move(makeRecord))) {
  if (implementation_->watches.fd() < 0) return;
  implementation_->watch =
      loop.watch(implementation_->watches.fd(), EPOLLIN, [weak = std::weak_ptr(implementation_)](std::uint32_t) {
        if (const auto self = weak.lock()) self->changesAreReadable();
      });
}

ExtensionDiscovery::~ExtensionDiscovery() { implementation_->watch.reset(); }

std::shared_ptr<ExtensionMatching> ExtensionDiscovery::beginMatching(const Dictionary &attributes,
                                                                     ExtensionMatchingHandler handler) {
  const auto point = attributes.find(extensionPointAttribute);
  const std::string *name = point == attributes.end() ? nullptr : point->second.string();
  auto matching = std::make_shared<Matching>(name ? std::optional(*name) : std::nullopt, std::move(handler));
  implementation_->queue->async([weak = std::weak_ptr(implementation_), weakMatching = std::weak_ptr(matching)] {
    const std::shared_ptr<Implementation> self = weak.lock();
    const std::shared_ptr<Matching> added = weakMatching.lock();
    if (!self || !added) return;
    self->matchings.push_back(added);
    if (!self->hasLooked) self->look();
    if (self->hasLooked) added->deliver(self->places, self->found, self->error);
  });
  return matching;
}

std::shared_ptr<const ExtensionBundle> ExtensionDiscovery::bundleForIdentifier(const std::string &identifier) {
  Implementation &self = *implementation_;
  bool hasLooked = false;
  {
    const std::lock_guard lock(self.mutex);
    hasLooked = self.hasLooked;
  }
  if (!hasLooked) {
    self.queue->sync([&self] {
      if (!self.hasLooked) self.look();
    });
  }
  const std::lock_guard lock(self.mutex);
  const auto match = std::find_if(self.found.begin(), self.found.end(), [&identifier](const FoundExtension &extension) {
    return extension.bundle->identifier == identifier;
  });
  return match == self.found.end() ? nullptr : match->bundle;
}

}  // namespace storix::linuxhost
