// From the start of the process to its first answer.

#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "bench/Benchmarks.h"
#include "bench/BusClient.h"
#include "bench/Scene.h"

namespace storix::bench {

namespace {

constexpr double startUpBound = 2;

}  // namespace

void measureStartUp(Table &table) {
  table.section("Start-up, on one processor");
  pinToOneProcessor();
  const Scene scene;
  scene.beApplication("org.sample.bench");
  const std::string bareSocket = scene.directory() / "bare.socket";
  double bareTook = 0;
  double took = 0;
  Rounds floor;
  Rounds measured;
  // The first round warms the caches of files up.
  const std::size_t rounds = table.extent().times(25, 1);
  for (std::size_t round = 0; round <= rounds; ++round) {
    std::unique_ptr<Program> program;
    bareTook = nanosecondsOf([&scene, &bareSocket, &program] {
      program = scene.startBare({"echo", bareSocket});
      BusClient(bareSocket).call("WakeUp");
    });
    program.reset();
    std::error_code ignored;
    std::filesystem::remove(scene.serviceSocket(), ignored);
    took = nanosecondsOf([&scene, &program] {
      program = scene.startDaemon();
      BusClient(scene.serviceSocket()).call("WakeUp");
    });
    program.reset();
    if (round == 0) continue;
    floor.push_back(bareTook);
    measured.push_back(took);
  }
  table.against("start to the first answer, no providers", measured, "sd-bus server on the same socket", floor,
                startUpBound);
}

}  // namespace storix::bench
