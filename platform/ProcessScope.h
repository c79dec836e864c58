#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>

#include "platform/OnceToken.h"

namespace storix {

class PlatformServices;

/// What there is one of per process: the platform, and the objects that are made on first use and
/// live as long as the process. `main` makes one scope; a test makes a fresh one per case and so
/// starts with nothing made.
///
/// At most one scope exists at a time. It must be destroyed after the platform's queues have become
/// idle, since their tasks may ask for it.
class ProcessScope {
 public:
  explicit ProcessScope(PlatformServices &platform);
  ~ProcessScope();
  ProcessScope(const ProcessScope &) = delete;
  ProcessScope &operator=(const ProcessScope &) = delete;

  /// The scope in place. Using it without one is a programming error.
  static ProcessScope &current();
  /// The same, or null without one.
  static ProcessScope *currentOrNull();

  [[nodiscard]] PlatformServices &platform() const { return platform_; }

  /// The scope's one object of this type, made by `make` (which gives a `shared_ptr<T>`) on the first
  /// call; concurrent first callers wait and get the same one.
  template <class T, class Make>
  const std::shared_ptr<T> &instance(Make &&make) {
    Slot &slot = slotFor(&typeKey<T>);
    slot.once.runOnce([&] { slot.object = std::make_shared<std::shared_ptr<T>>(make()); });
    return *static_cast<std::shared_ptr<T> *>(slot.object.get());
  }

 private:
  struct Slot {
    OnceToken once;
    std::shared_ptr<void> object;
  };
  template <class T>
  static inline const char typeKey = 0;

  Slot &slotFor(const void *key);

  PlatformServices &platform_;
  std::mutex mutex_;
  std::map<const void *, Slot> slots_;
};

}  // namespace storix
