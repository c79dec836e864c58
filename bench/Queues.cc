// The work queues, beside a mutex.

#include <algorithm>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bench/Benchmarks.h"
#include "platform/Queue.h"
#include "platform/ThreadPool.h"

namespace storix::bench {

namespace {

constexpr double syncBound = 3;
constexpr std::size_t contenders = 4;

/// Counts, so that nothing is optimised away.
struct Counted {
  std::size_t value = 0;
};

/// Submits tasks, and waits for the last one.
template <class Submit>
void submitAndWait(std::size_t times, Counted &counted, const Submit &submit) {
  std::mutex mutex;
  std::condition_variable changed;
  bool over = false;
  for (std::size_t i = 0; i + 1 < times; ++i) submit([&counted] { ++counted.value; });
  submit([&mutex, &changed, &over] {
    const std::lock_guard lock(mutex);
    over = true;
    changed.notify_one();
  });
  std::unique_lock lock(mutex);
  changed.wait(lock, [&over] { return over; });
}

template <class Work>
void onContenders(std::size_t times, const Work &work) {
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < contenders; ++i) {
    threads.emplace_back([&work, times] {
      for (std::size_t done = 0; done < times / contenders + 1; ++done) work();
    });
  }
  for (std::thread &thread : threads) thread.join();
}

}  // namespace

void measureQueues(Table &table) {
  table.section("Queues");
  ThreadPool pool;
  const auto serial = SerialQueue::create(pool, "serial");
  const auto concurrent = ConcurrentQueue::create(pool, "concurrent");
  std::mutex mutex;
  Counted counted;

  const auto looped = [](auto work) {
    return Contestant{"", [work](std::size_t times) {
                        for (std::size_t i = 0; i < times; ++i) work();
                      }};
  };
  const auto locked = [&mutex, &counted] {
    const std::lock_guard lock(mutex);
    ++counted.value;
  };
  const auto onSerial = [&serial, &counted] { serial->sync([&counted] { ++counted.value; }); };
  const auto onConcurrent = [&concurrent, &counted] { concurrent->sync([&counted] { ++counted.value; }); };
  const auto behindBarrier = [&concurrent, &counted] { concurrent->syncBarrier([&counted] { ++counted.value; }); };

  pinToOneProcessor();
  const auto rounds =
      compare(table.extent(), {looped(locked), looped(onSerial), looped(onConcurrent), looped(behindBarrier)});
  table.against("sync on a serial queue, uncontended", rounds[1], "std::mutex", rounds[0], syncBound);
  table.against("sync on a concurrent queue, uncontended", rounds[2], "std::mutex", rounds[0], syncBound);
  table.against("syncBarrier on a concurrent queue, uncontended", rounds[3], "std::mutex", rounds[0]);

  useAllProcessors();
  const auto submitted = compare(
      table.extent(),
      {{"",
        [&](std::size_t times) { submitAndWait(times, counted, [&](Task task) { serial->async(std::move(task)); }); }},
       {"", [&](std::size_t times) {
          submitAndWait(times, counted, [&](Task task) { concurrent->asyncBarrier(std::move(task)); });
        }}});
  table.plain("async on a serial queue, a long row of tasks, each", submitted[0]);
  table.plain("asyncBarrier on a concurrent queue, the same", submitted[1]);

  const auto contended =
      compare(table.extent(), {{"", [&](std::size_t times) { onContenders(times, locked); }},
                               {"", [&](std::size_t times) { onContenders(times, onSerial); }},
                               {"", [&](std::size_t times) { onContenders(times, behindBarrier); }}});
  table.against("sync on a serial queue, four threads, each call", contended[1], "std::mutex, four threads",
                contended[0]);
  table.against("syncBarrier on a concurrent queue, four threads", contended[2], "std::mutex, four threads",
                contended[0]);
}

}  // namespace storix::bench
