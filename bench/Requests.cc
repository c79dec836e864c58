// Requests to the real daemon, which asks a real extension process: beside the same messages between
// programs that do nothing else.

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "bench/Benchmarks.h"
#include "bench/BusClient.h"
#include "bench/Scene.h"
#include "platform/URL.h"

namespace storix::bench {

namespace {

constexpr double wakeUpBound = 1.2;
constexpr double startProvidingBound = 1.3;
constexpr double eightClientsBound = 0.85;
constexpr std::size_t clientCount = 8;

const std::string application = "org.sample.bench";
const std::string bareProvider = "org.sample.bare";
const std::string sdkProvider = "org.sample.sdk";

std::string documentURL(const Scene &scene, const std::string &provider, const std::string &name) {
  return URL::fileURLWithPath((scene.storage(provider) / name).string())->absoluteString();
}

/// The programs that stand for the daemon, and where they listen.
struct BarePrograms {
  explicit BarePrograms(const Scene &scene)
      : directory(scene.directory()),
        raw(scene.startBare({"raw", socket("raw")})),
        echo(scene.startBare({"echo", socket("echo")})),
        vendor(scene.startBare({"vendor", socket("vendor")})),
        relayVendor(scene.startBare({"vendor", socket("vendor2")})),
        broker(scene.startBare({"broker", socket("broker"), socket("vendor")})),
        relay(scene.startBare({"relay", socket("relay"), socket("vendor2")})) {}

  [[nodiscard]] std::string socket(const std::string &name) const { return directory / (name + ".socket"); }

  std::filesystem::path directory;
  std::unique_ptr<Program> raw;
  std::unique_ptr<Program> echo;
  std::unique_ptr<Program> vendor;
  std::unique_ptr<Program> relayVendor;
  std::unique_ptr<Program> broker;
  std::unique_ptr<Program> relay;
};

void roundTrips(int fd, std::size_t times) {
  char byte = 'x';
  for (std::size_t i = 0; i < times; ++i) {
    if (::write(fd, &byte, 1) != 1 || ::read(fd, &byte, 1) != 1) giveUp("The raw echo has gone.");
  }
}

Contestant calling(std::string name, BusClient &client, const char *method, std::vector<std::string> arguments) {
  return {std::move(name), [&client, method, arguments = std::move(arguments)](std::size_t times) {
            for (std::size_t i = 0; i < times; ++i) client.call(method, arguments);
          }};
}

/// Clients with a connection and a thread each, which all call WakeUp until the time is over.
class Crowd {
 public:
  explicit Crowd(const std::string &socket) {
    for (std::size_t i = 0; i < clientCount; ++i) clients_.emplace_back(socket).call("WakeUp");
  }

  double callsPerSecond(double seconds) {
    std::atomic<bool> over{false};
    std::atomic<std::size_t> calls{0};
    std::vector<std::thread> threads;
    const double took = nanosecondsOf([this, seconds, &over, &calls, &threads] {
      for (BusClient &client : clients_) {
        threads.emplace_back([&client, &over, &calls] {
          std::size_t mine = 0;
          for (; !over.load(std::memory_order_relaxed); ++mine) client.call("WakeUp");
          calls += mine;
        });
      }
      std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
      over = true;
      for (std::thread &thread : threads) thread.join();
    });
    return static_cast<double>(calls.load()) / (took / 1e9);
  }

 private:
  std::vector<BusClient> clients_;
};

void measureCrowd(Table &table, const Scene &scene, const std::string &bareSocket) {
  Crowd ours(scene.serviceSocket());
  Crowd bare(bareSocket);
  Rounds measured;
  Rounds floor;
  for (std::size_t round = 0; round < table.extent().rounds(); ++round) {
    const double seconds = table.extent().secondsPerRound() * 5;
    measured.push_back(ours.callsPerSecond(seconds));
    floor.push_back(bare.callsPerSecond(seconds));
  }
  Figure figure;
  figure.what = "WakeUp, eight clients, " + std::to_string(processorCount()) + " processors";
  figure.unit = Unit::callsPerSecond;
  figure.measured = median(measured);
  figure.floorName = "sd-bus, a thread a connection";
  figure.floor = median(floor);
  figure.ratio = ratio(measured, floor);
  figure.bound = "ratio ≥ 0.85";
  figure.met = *figure.ratio >= eightClientsBound;
  table.add(std::move(figure));
}

void measureFloorRequests(Table &table, const Scene &scene, const BarePrograms &bare) {
  const UniqueFd raw = connectTo(bare.socket("raw"));
  BusClient echo(bare.socket("echo"));
  BusClient relay(bare.socket("relay"));
  const std::string url = documentURL(scene, bareProvider, "document");
  struct stat status {};
  std::mutex mutex;
  const std::vector<Contestant> contestants{
      {"a raw socket round trip", [&raw](std::size_t times) { roundTrips(raw.get(), times); }},
      calling("sd-bus echo, peer to peer", echo, "WakeUp", {}),
      calling("sd-bus with a second hop", relay, "StartProvidingItemAtURL", {url, bareProvider, application}),
      {"an uncontended std::mutex",
       [&mutex](std::size_t times) {
         for (std::size_t i = 0; i < times; ++i) const std::lock_guard lock(mutex);
       }},
      {"stat of a provider's directory",
       [&scene, &status](std::size_t times) {
         const std::string directory = scene.storage(bareProvider);
         for (std::size_t i = 0; i < times; ++i) (void)::stat(directory.c_str(), &status);
       }},
  };
  const std::vector<Rounds> rounds = compare(table.extent(), contestants);
  for (std::size_t i = 0; i < contestants.size(); ++i) table.plain(contestants[i].name, rounds[i]);
}

}  // namespace

void measureFloors(Table &table) {
  table.section("Floors, on one processor");
  pinToOneProcessor();
  const Scene scene;
  scene.installProvider(bareProvider, "storix_bench_bare");
  const BarePrograms bare(scene);
  measureFloorRequests(table, scene, bare);

  for (const std::size_t kilobytes : {1U, 100U, 1000U}) {
    const std::string content(kilobytes << 10, 'x');
    const auto rounds = compareTimes(table.extent(),
                                     {{"",
                                       [&scene, &content](std::size_t times) {
                                         for (std::size_t i = 0; i < times; ++i) {
                                           writeDurably(scene.home() / "floor", content);
                                         }
                                       }}},
                                     table.extent().times(10, 1));
    table.plain("write, fsync, rename, fsync of the directory: " + std::to_string(kilobytes) + " KiB", rounds[0]);
  }
}

void measureRequests(Table &table) {
  const Scene scene;
  scene.beApplication(application);
  scene.installProvider(bareProvider, "storix_bench_bare");
  scene.installProvider(sdkProvider, "storix_bench_provider");

  table.section("Requests, one client, all processes on one processor");
  pinToOneProcessor();
  {
    const BarePrograms bare(scene);
    const auto daemon = scene.startDaemon();
    BusClient client(scene.serviceSocket());
    BusClient echo(bare.socket("echo"));
    BusClient broker(bare.socket("broker"));
    BusClient relay(bare.socket("relay"));
    const std::string url = documentURL(scene, bareProvider, "document");
    const std::string sdkURL = documentURL(scene, sdkProvider, "document");
    client.call("ExtendSandboxForFileURL", {url, bareProvider, application});
    client.call("ExtendSandboxForFileURL", {sdkURL, sdkProvider, application});
    const std::string bookmark = client.callForText("BookmarkableStringFromDocumentURL", {url});
    const std::string trips = "sd-bus echo";
    const std::string twoHops = "sd-bus with a second hop";

    std::vector<Contestant> contestants{
        calling("", echo, "WakeUp", {}),
        calling("", relay, "StartProvidingItemAtURL", {url, bareProvider, application}),
        calling("", broker, "StartProvidingItemAtURL", {url, bareProvider, application}),
        calling("", client, "WakeUp", {}),
        calling("", client, "StartProvidingItemAtURL", {url, bareProvider, application}),
        calling("", client, "StartProvidingItemAtURL", {sdkURL, sdkProvider, application}),
        calling("", client, "Providers", {}),
        calling("", client, "ExtendSandboxForFileURL", {url, bareProvider, application}),
        calling("", client, "BookmarkableStringFromDocumentURL", {url}),
        calling("", client, "DocumentURLFromBookmarkableString", {bookmark}),
    };
    const std::vector<Rounds> rounds = compare(table.extent(), contestants);
    const std::string threeTrips = "three sd-bus round trips";
    table.against("WakeUp", rounds[3], trips, rounds[0], wakeUpBound);
    table.against("StartProvidingItemAtURL", rounds[4], threeTrips, rounds[2], startProvidingBound);
    table.against("StartProvidingItemAtURL, an extension made with the SDK", rounds[5], threeTrips, rounds[2]);
    table.against("Providers (two of them)", rounds[6], trips, rounds[0]);
    table.against("ExtendSandboxForFileURL, the grant is there", rounds[7], twoHops, rounds[1]);
    table.against("BookmarkableStringFromDocumentURL", rounds[8], twoHops, rounds[1]);
    table.against("DocumentURLFromBookmarkableString", rounds[9], twoHops, rounds[1]);

    std::size_t made = 0;
    const auto newGrants =
        compareTimes(table.extent(),
                     {{"",
                       [&client, &scene, &made](std::size_t times) {
                         for (std::size_t i = 0; i < times; ++i) {
                           const std::string fresh = documentURL(scene, bareProvider, "new" + std::to_string(++made));
                           client.call("ExtendSandboxForFileURL", {fresh, bareProvider, application});
                         }
                       }},
                      {"",
                       [&scene](std::size_t times) {
                         const std::string content(200, 'x');
                         for (std::size_t i = 0; i < times; ++i) writeDurably(scene.home() / "floor", content);
                       }}},
                     table.extent().times(20, 2));
    table.against("ExtendSandboxForFileURL, a new grant", newGrants[0], "200 bytes written durably", newGrants[1]);
  }

  table.section("Requests, eight clients");
  useAllProcessors();
  const auto daemon = scene.startDaemon();
  const std::string socket = scene.directory() / "crowd.socket";
  const auto echo = scene.startBare({"echo", socket});
  measureCrowd(table, scene, socket);
}

}  // namespace storix::bench
