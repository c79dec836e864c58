#include "platform/ProcessScope.h"

#include <atomic>

#include "platform/Log.h"

namespace storix {
namespace {

std::atomic<ProcessScope *> scopeInPlace{nullptr};

}  // namespace

ProcessScope::ProcessScope(PlatformServices &platform) : platform_(platform) {
  ProcessScope *none = nullptr;
  if (!scopeInPlace.compare_exchange_strong(none, this)) {
    endProcessForProgrammingError("A second process scope was made while one is in place.");
  }
}

ProcessScope::~ProcessScope() {
  // The objects go one by one, while the scope is still in place: they may log, or ask for each other.
  std::unique_lock lock(mutex_);
  while (!slots_.empty()) {
    auto slot = slots_.extract(slots_.begin());
    lock.unlock();
    slot.mapped().object.reset();
    lock.lock();
  }
  scopeInPlace.store(nullptr);
}

ProcessScope &ProcessScope::current() {
  ProcessScope *scope = scopeInPlace.load(std::memory_order_acquire);
  if (!scope) endProcessForProgrammingError("The process scope was used before it was made.");
  return *scope;
}

ProcessScope *ProcessScope::currentOrNull() { return scopeInPlace.load(std::memory_order_acquire); }

ProcessScope::Slot &ProcessScope::slotFor(const void *key) {
  const std::lock_guard lock(mutex_);
  return slots_[key];
}

}  // namespace storix
