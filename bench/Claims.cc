// Claims on files at the platform socket, while many others are held.

#include <cstdint>
#include <deque>
#include <string>
#include <vector>

#include "bench/Benchmarks.h"
#include "bench/BusClient.h"
#include "bench/Scene.h"
#include "platform/URL.h"

namespace storix::bench {

namespace {

/// So many claims one connection of the benchmark holds; the daemon has a limit.
constexpr std::size_t claimsOfConnection = 500;

std::string fileURL(const Scene &scene, std::size_t number) {
  const auto path = scene.directory() / "files" / std::to_string(number % 100) / ("file " + std::to_string(number));
  return URL::fileURLWithPath(path.string())->absoluteString();
}

}  // namespace

void measureClaims(Table &table) {
  table.section("File coordination: BeginRead and EndRead while other claims are held, on one processor");
  pinToOneProcessor();
  const std::string provider = "org.sample.bare";
  const Scene scene;
  scene.beApplication("org.sample.bench");
  scene.installProvider(provider, "storix_bench_bare");
  const auto daemon = scene.startDaemon();
  const std::string echoSocket = scene.directory() / "echo.socket";
  const auto bare = scene.startBare({"echo", echoSocket});
  BusClient echo(echoSocket);
  BusClient client(scene.platformSocket());
  BusClient(scene.serviceSocket()).call("Providers");

  const auto claiming = [&client](std::string url) {
    return Contestant{"", [&client, url = std::move(url)](std::size_t times) {
                        for (std::size_t i = 0; i < times; ++i) client.endRead(client.beginRead(url));
                      }};
  };
  const Contestant twoTrips{"", [&echo](std::size_t times) {
                              for (std::size_t i = 0; i < 2 * times; ++i) echo.call("WakeUp");
                            }};
  const std::string provided = URL::fileURLWithPath((scene.storage(provider) / "document").string())->absoluteString();

  std::deque<BusClient> holders;
  std::size_t held = 0;
  for (const std::size_t others : {std::size_t{0}, std::size_t{1000}, table.extent().times(10'000, 2000)}) {
    for (; held < others; ++held) {
      if (held % claimsOfConnection == 0) holders.emplace_back(scene.platformSocket());
      (void)holders.back().beginRead(fileURL(scene, held));
    }
    const auto rounds = compare(table.extent(), {twoTrips, claiming(fileURL(scene, 1'000'000))});
    table.against("outside all providers, " + std::to_string(others) + " others", rounds[1], "two sd-bus echoes",
                  rounds[0]);
  }
  const auto rounds = compare(table.extent(), {twoTrips, claiming(provided)});
  table.against("of a provider, which is asked, " + std::to_string(held) + " others", rounds[1], "two sd-bus echoes",
                rounds[0]);
}

}  // namespace storix::bench
