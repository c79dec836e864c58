#pragma once

#include <functional>
#include <thread>
#include <vector>

namespace storix {

/// Threads that run the body, each with its number.
inline std::vector<std::thread> startThreads(int count, const std::function<void(int)> &body) {
  std::vector<std::thread> threads;
  threads.reserve(static_cast<std::size_t>(count));
  for (int i = 0; i < count; ++i) threads.emplace_back(body, i);
  return threads;
}

inline void join(std::vector<std::thread> threads) {
  for (std::thread &thread : threads) thread.join();
}

}  // namespace storix
