// storix_bench [--quick] [--only PART]... [--into FILE]
//   --quick  everything once and shortly, without bounds: does it still run?
//   --only   floors, requests, claims, store, queues, registry, start-up, memory or peers
//   --into   puts the table into a page, between the lines that mark its place

#include <sys/utsname.h>

#include <algorithm>
#include <array>
#include <condition_variable>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <iterator>
#include <mutex>
#include <optional>
#include <stop_token>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "bench/Benchmarks.h"

namespace {

using storix::bench::Table;

struct Part {
  std::string_view name;
  void (*measure)(Table &);
  bool inQuickForm;
};

constexpr Part parts[] = {
    {"floors", storix::bench::measureFloors, true},    {"requests", storix::bench::measureRequests, true},
    {"claims", storix::bench::measureClaims, true},    {"store", storix::bench::measureStore, true},
    {"queues", storix::bench::measureQueues, true},    {"registry", storix::bench::measureRegistry, true},
    {"start-up", storix::bench::measureStartUp, true}, {"memory", storix::bench::measureMemory, true},
    {"peers", storix::bench::measurePeers, false},
};

constexpr std::string_view tableBegin = "<!-- table begins -->\n";
constexpr std::string_view tableEnd = "<!-- table ends -->\n";

/// The value of the first line of a file under /proc that begins with the key.
std::string valueOf(const char *file, std::string_view key) {
  std::ifstream input(file);
  for (std::string line; std::getline(input, line);) {
    if (!line.starts_with(key)) continue;
    const std::size_t value = line.find_first_not_of(" \t", line.find(':') + 1);
    return value == std::string::npos ? std::string() : line.substr(value);
  }
  return "unknown";
}

std::string machine() {
  utsname system{};
  (void)::uname(&system);
  const std::time_t now = std::time(nullptr);
  std::array<char, 32> day{};
  (void)std::strftime(day.data(), day.size(), "%Y-%m-%d", std::gmtime(&now));
  return "\nMeasured on " + std::string(day.data()) + ": " + std::to_string(storix::bench::processorCount()) +
         " processors (" + valueOf("/proc/cpuinfo", "model name") + "), " + valueOf("/proc/meminfo", "MemTotal") +
         " of memory, Linux " + system.release + ", compiler " + __VERSION__ + ", build \"release\".\n";
}

bool putInto(const std::string &page, const std::string &table) {
  std::ifstream input(page, std::ios::binary);
  std::string text((std::istreambuf_iterator<char>(input)), std::istreambuf_iterator<char>());
  const std::size_t begin = text.find(tableBegin);
  const std::size_t end = text.find(tableEnd);
  if (begin == std::string::npos || end == std::string::npos || end < begin) return false;
  const std::size_t start = begin + tableBegin.size();
  text.replace(start, end - start, table);
  std::ofstream output(page, std::ios::binary | std::ios::trunc);
  output << text;
  return static_cast<bool>(output.flush());
}

int usage() {
  (void)std::fputs("usage: storix_bench [--quick] [--only PART]... [--into FILE]\nPARTs:", stderr);
  for (const Part &part : parts) (void)std::fprintf(stderr, " %s", std::string(part.name).c_str());
  (void)std::fputs("\n", stderr);
  return 2;
}

}  // namespace

int main(int count, char **arguments) {
  storix::bench::Extent extent;
  std::vector<std::string_view> only;
  std::optional<std::string> page;
  for (int i = 1; i < count; ++i) {
    const std::string_view argument = arguments[i];
    if (argument == "--quick") {
      extent.quick = true;
    } else if (argument == "--only" && i + 1 < count) {
      only.emplace_back(arguments[++i]);
    } else if (argument == "--into" && i + 1 < count) {
      page = arguments[++i];
    } else {
      return usage();
    }
  }
  for (const std::string_view name : only) {
    if (std::none_of(std::begin(parts), std::end(parts), [name](const Part &part) { return part.name == name; })) {
      return usage();
    }
  }
  // A lock costs a process of one thread a quarter of what it costs the daemon, which has several.
  const std::jthread another([](const std::stop_token &end) {
    std::mutex mutex;
    std::unique_lock lock(mutex);
    std::condition_variable_any().wait(lock, end, [] { return false; });
  });
  Table table(extent);
  for (const Part &part : parts) {
    const bool named = std::find(only.begin(), only.end(), part.name) != only.end();
    if (named || (only.empty() && (part.inQuickForm || !extent.quick))) part.measure(table);
  }
  if (!extent.quick) std::printf("\nBounds that are not met: %zu\n", table.missedBounds());
  if (page && !putInto(*page, machine() + table.markdown())) {
    (void)std::fprintf(stderr, "storix_bench: %s has no place for the table.\n", page->c_str());
    return 1;
  }
  return 0;
}
