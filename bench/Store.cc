// The store of grants, in this process: questions and new grants, however many there are.

#include <algorithm>
#include <filesystem>
#include <memory>
#include <numeric>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "access/SXAccessControlStore.h"
#include "bench/BenchHost.h"
#include "bench/Benchmarks.h"
#include "bench/Scene.h"
#include "platform/ProcessScope.h"

namespace storix::bench {

namespace {

constexpr double queryBoundNanoseconds = 200;
constexpr double grantBound = 2;
constexpr std::size_t grantsOfBound = 10'000;
constexpr std::size_t mostGrants = 100'000;

struct Question {
  SXAccessControlStore::Identifier provider;
  SXAccessControlStore::Identifier item;
  SXAccessControlStore::Identifier consumer;
};

/// Each grant once, in no order. The questions themselves lie in the order in which they are asked, so
/// that what is slow is to find the grant and not to read the question.
std::vector<Question> questions(std::size_t count, bool spread) {
  std::vector<std::size_t> order(count);
  std::iota(order.begin(), order.end(), 0);
  std::shuffle(order.begin(), order.end(), std::minstd_rand(1));
  std::vector<Question> all;
  all.reserve(count);
  for (const std::size_t index : order) {
    Grant grant = grantNumber(index, spread);
    all.push_back({std::move(grant.provider), std::move(grant.item), std::move(grant.consumer)});
  }
  return all;
}

void measureQueries(Table &table, SXAccessControlStore &store, std::size_t count, bool spread) {
  const std::vector<Question> asked = questions(count, spread);
  std::size_t next = 0;
  const auto rounds = compare(
      table.extent(), {{"", [&store, &asked, &next](std::size_t times) {
                          for (std::size_t i = 0; i < times; ++i) {
                            const Question &question = asked[next];
                            next = next + 1 == asked.size() ? 0 : next + 1;
                            if (!store.isProviderWithIdentifier(question.provider, question.item, question.consumer)) {
                              giveUp("A grant is not found.");
                            }
                          }
                        }}});
  Figure figure;
  figure.what = "a query, " + std::to_string(count) + " grants, " + (spread ? "spread" : "one consumer");
  figure.measured = median(rounds[0]);
  if (count == mostGrants) {
    figure.bound = "under 200 ns";
    figure.met = figure.measured < queryBoundNanoseconds;
  }
  table.add(std::move(figure));
}

/// A new grant, and the same bytes written by hand.
void measureGrants(Table &table, const Scene &scene, SXAccessControlStore &store, std::size_t count, bool spread) {
  const std::string name = std::to_string(count) + " grants, " + (spread ? "spread" : "one consumer");
  const std::size_t times = table.extent().times(count > grantsOfBound ? 3 : 10, 1);
  std::string content(std::filesystem::file_size(scene.accessControlFile()), 'x');
  std::size_t next = count;
  const auto rounds = compareTimes(table.extent(),
                                   {{"",
                                     [&store, &next, spread](std::size_t n) {
                                       for (std::size_t i = 0; i < n; ++i) {
                                         const Grant grant = grantNumber(next++, spread);
                                         store.allowProviderWithIdentifier(grant.provider, grant.item, grant.consumer);
                                       }
                                     }},
                                    {"",
                                     [&scene, &content](std::size_t n) {
                                       for (std::size_t i = 0; i < n; ++i)
                                         writeDurably(scene.home() / "floor", content);
                                     }}},
                                   times);
  table.against("a new grant beside " + name, rounds[0], "its " + std::to_string(content.size() >> 10) + " KiB durably",
                rounds[1], count == grantsOfBound ? std::optional(grantBound) : std::nullopt);
}

}  // namespace

void measureStore(Table &table) {
  table.section("The store of grants, on one processor");
  pinToOneProcessor();
  const Scene scene;
  BenchHost host(scene.home());
  for (const bool spread : {false, true}) {
    for (const std::size_t count : {10U, 100U, 1000U, 10'000U, 100'000U}) {
      if (table.extent().quick && count > grantsOfBound) continue;
      scene.writeGrants(grants(count, spread));
      ProcessScope scope(host);
      const auto store = SXAccessControlStore::sharedStore();
      measureQueries(table, *store, count, spread);
      measureGrants(table, scene, *store, count, spread);
    }
  }
  host.end();
}

}  // namespace storix::bench
