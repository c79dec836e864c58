// What the daemon's memory grows with.

#include <chrono>
#include <deque>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "bench/Benchmarks.h"
#include "bench/BusClient.h"
#include "bench/Scene.h"

namespace storix::bench {

namespace {

constexpr double idleBound = 4.0 * 1024 * 1024;
constexpr double connectionBound = 16.0 * 1024;
/// What an allocator may keep for itself without anything growing.
constexpr double growthBound = 64.0 * 1024;

void bounded(Table &table, std::string what, double bytes, std::string bound, double most) {
  Figure figure;
  figure.what = std::move(what);
  figure.unit = Unit::bytes;
  figure.measured = bytes;
  figure.bound = std::move(bound);
  if (!figure.bound.empty()) figure.met = bytes <= most;
  table.add(std::move(figure));
}

/// Threads that had something to do at the start have gone by then.
void settle(const Table &table) {
  std::this_thread::sleep_for(table.extent().quick ? std::chrono::milliseconds(10) : std::chrono::seconds(12));
}

}  // namespace

void measureMemory(Table &table) {
  table.section("Memory (PSS) of the daemon");
  useAllProcessors();
  const Scene scene;
  scene.beApplication("org.sample.bench");
  const std::string echoSocket = scene.directory() / "echo.socket";
  {
    const auto bare = scene.startBare({"echo", echoSocket});
    const auto daemon = scene.startDaemon();
    BusClient client(scene.serviceSocket());
    BusClient echo(echoSocket);
    client.call("WakeUp");
    echo.call("WakeUp");
    settle(table);
    bounded(table, "a bare sd-bus server with one connection", bare->proportionalSetSize(), "", 0);
    const double idle = daemon->proportionalSetSize();
    bounded(table, "idle, no providers", idle, "≤ 4 MiB", idleBound);

    const std::size_t connections = table.extent().times(1000, 50);
    {
      std::deque<BusClient> clients;
      for (std::size_t i = 0; i < connections; ++i) clients.emplace_back(scene.serviceSocket()).call("WakeUp");
      bounded(table, "each of " + std::to_string(connections) + " idle connections",
              (daemon->proportionalSetSize() - idle) / static_cast<double>(connections), "≤ 16 KiB", connectionBound);
    }

    const std::size_t requests = table.extent().times(1'000'000, 1000);
    const std::size_t warmUp = requests / 10;
    for (std::size_t i = 0; i < warmUp; ++i) client.call("WakeUp");
    const double before = daemon->proportionalSetSize();
    for (std::size_t i = 0; i < requests; ++i) client.call(i % 2 == 0 ? "WakeUp" : "Providers");
    bounded(table, "growth over " + std::to_string(requests) + " requests", daemon->proportionalSetSize() - before,
            "≤ 64 KiB", growthBound);
  }
  const std::size_t count = table.extent().times(100'000, 1000);
  scene.writeGrants(grants(count, true));
  const auto daemon = scene.startDaemon();
  BusClient(scene.serviceSocket()).call("WakeUp");
  bounded(table, "with " + std::to_string(count) + " grants", daemon->proportionalSetSize(), "", 0);
}

}  // namespace storix::bench
