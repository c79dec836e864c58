#pragma once

#include <mutex>
#include <utility>

namespace storix {

/// Runs a task the first time only, for the life of the token; concurrent first callers wait until
/// it has run.
class OnceToken {
 public:
  template <class Function>
  void runOnce(Function &&function) {
    std::call_once(flag_, std::forward<Function>(function));
  }

 private:
  std::once_flag flag_;
};

}  // namespace storix
