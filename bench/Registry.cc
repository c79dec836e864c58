// The registry of providers, in this process but with real directories; and finding them on the disk.

#include <sys/stat.h>

#include <condition_variable>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "bench/BenchHost.h"
#include "bench/Benchmarks.h"
#include "bench/Scene.h"
#include "platform/ProcessScope.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "providers/SXExtensionStorix.h"

namespace storix::bench {

namespace {

constexpr double lookupBound = 1.5;

std::string providerNumber(std::size_t number) { return "org.sample.provider" + std::to_string(10'000 + number); }

/// Waits for what happens on other threads.
class Event {
 public:
  void happen() {
    const std::lock_guard lock(mutex_);
    happened_ = true;
    changed_.notify_all();
  }
  void await() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return happened_; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  bool happened_ = false;
};

void measureLookups(Table &table, const Scene &scene, std::size_t count) {
  const std::filesystem::path groups = scene.directory() / "data/storix/groups";
  BenchHost host(scene.home());
  ProcessScope scope(host);
  std::vector<std::string> identifiers;
  std::vector<std::string> directories;
  for (std::size_t i = 0; i < count; ++i) {
    identifiers.push_back(providerNumber(i));
    directories.push_back(scene.storage(identifiers.back()));
    std::filesystem::create_directories(directories.back());
  }
  host.install(identifiers, groups);
  Event refreshed;
  const double refresh = nanosecondsOf([&refreshed] {
    SXExtensionStorix::createInstancesCompletion([&refreshed] { refreshed.happen(); });
    refreshed.await();
  });

  // Of the provider that is asked last.
  const auto item = URL::fileURLWithPath(directories.back() + "/Folder/document.txt");
  std::filesystem::create_directories(directories.back() + "/Folder");
  struct stat status {};
  const auto rounds = compare(table.extent(), {{"",
                                                [&directories, &status](std::size_t times) {
                                                  for (std::size_t i = 0; i < times; ++i) {
                                                    for (const std::string &directory : directories) {
                                                      (void)::stat(directory.c_str(), &status);
                                                    }
                                                  }
                                                }},
                                               {"", [&item](std::size_t times) {
                                                  for (std::size_t i = 0; i < times; ++i) {
                                                    if (!SXExtensionStorix::providerForURL(item)) {
                                                      giveUp("The provider of a URL is not found.");
                                                    }
                                                  }
                                                }}});
  const std::string stats = count == 1 ? "one stat" : std::to_string(count) + " stats";
  table.against("URL lookup, the last of " + std::to_string(count) + " providers", rounds[1], stats, rounds[0],
                lookupBound);
  if (count == 1000) {
    Figure figure;
    figure.what = "a refresh that registers 1000 providers";
    figure.measured = refresh;
    table.add(std::move(figure));
  }
  host.end();
}

class NobodyWatches : public linuxhost::DirectoryReadingObserver {
 public:
  void willReadExtensionDirectory(const std::string & /*path*/) override {}
  void willReadBundle(const std::string & /*path*/) override {}
};

void measureDiscovery(Table &table) {
  const Scene scene;
  const std::size_t count = table.extent().times(1000, 100);
  std::vector<std::string> files;
  for (std::size_t i = 0; i < count; ++i) {
    const std::string identifier = providerNumber(i);
    scene.installProvider(identifier, "storix_bench_bare");
    std::filesystem::remove(scene.extensions() / (identifier + ".appdex") / "provider");
    files.push_back(scene.extensions() / (identifier + ".appdex") / "Info.kvs");
  }
  const linuxhost::ExtensionPlaces places{{scene.extensions()}, scene.directory() / "data/storix/groups"};
  NobodyWatches observer;
  const auto rounds = compare(table.extent(), {{"",
                                                [&files](std::size_t times) {
                                                  for (std::size_t i = 0; i < times; ++i) {
                                                    for (const std::string &file : files) (void)Scene::read(file);
                                                  }
                                                }},
                                               {"", [&places, &observer, count](std::size_t times) {
                                                  for (std::size_t i = 0; i < times; ++i) {
                                                    const auto scan = linuxhost::scanExtensionBundles(places, observer);
                                                    if (scan.bundles.size() != count) giveUp("Bundles are missing.");
                                                  }
                                                }}});
  table.against("discovery of " + std::to_string(count) + " bundles", rounds[1],
                "reading " + std::to_string(count) + " files", rounds[0]);
}

}  // namespace

void measureRegistry(Table &table) {
  table.section("The registry, on one processor");
  pinToOneProcessor();
  {
    const Scene scene;
    for (const std::size_t count : {1U, 10U, 100U, 1000U}) measureLookups(table, scene, count);
  }
  measureDiscovery(table);
}

}  // namespace storix::bench
