#include "bench/Measure.h"

#include <sched.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <numeric>
#include <utility>

namespace storix::bench {

namespace {

cpu_set_t processorsAtStart() {
  static const cpu_set_t processors = [] {
    cpu_set_t set;
    CPU_ZERO(&set);
    if (::sched_getaffinity(0, sizeof set, &set) != 0) giveUp("The processors of this process cannot be told.");
    return set;
  }();
  return processors;
}

/// How many operations fill a slice: found by doubling, which warms the contestant up too.
std::size_t timesPerSlice(const Contestant &contestant, double seconds) {
  for (std::size_t times = 1;; times *= 2) {
    const double took = nanosecondsOf([&contestant, times] { contestant.run(times); }) / 1e9;
    if (took >= seconds) return times;
    if (took >= seconds / 8) {
      return std::max<std::size_t>(1, static_cast<std::size_t>(static_cast<double>(times) * seconds / took));
    }
  }
}

std::vector<Rounds> compareSlices(const Extent &extent, const std::vector<Contestant> &contestants,
                                  const std::vector<std::size_t> &times) {
  std::vector<Rounds> all(contestants.size());
  for (std::size_t round = 0; round < extent.rounds(); ++round) {
    for (std::size_t i = 0; i < contestants.size(); ++i) {
      const double took = nanosecondsOf([&contestants, &times, i] { contestants[i].run(times[i]); });
      all[i].push_back(took / static_cast<double>(times[i]));
    }
  }
  return all;
}

std::string text(const char *format, double number) {
  std::array<char, 64> buffer{};
  (void)std::snprintf(buffer.data(), buffer.size(), format, number);
  return buffer.data();
}

std::string quantity(Unit unit, double number) {
  if (unit == Unit::callsPerSecond) return text("%.0f/s", number);
  if (unit == Unit::bytes)
    return std::abs(number) < 1e6 ? text("%.1f KiB", number / 1024) : text("%.2f MiB", number / (1 << 20));
  if (number < 1000) return text("%.1f ns", number);
  if (number < 1e6) return text("%.2f µs", number / 1e3);
  if (number < 1e9) return text("%.2f ms", number / 1e6);
  return text("%.2f s", number / 1e9);
}

/// The columns of a line behind the first.
std::array<std::string, 5> cells(const Figure &figure) {
  std::string floor;
  if (figure.floor) floor = quantity(figure.unit, *figure.floor);
  if (!figure.floorName.empty()) floor += " (" + figure.floorName + ")";
  std::string met;
  if (figure.met) met = *figure.met ? "yes" : "NO";
  return {quantity(figure.unit, figure.measured), floor, figure.ratio ? text("%.2f", *figure.ratio) : "", figure.bound,
          met};
}

/// Padded to so many characters, not bytes.
std::string padded(const std::string &cell, std::size_t width) {
  const auto characters = static_cast<std::size_t>(std::count_if(
      cell.begin(), cell.end(), [](char byte) { return (static_cast<unsigned char>(byte) & 0xC0) != 0x80; }));
  return cell + std::string(characters < width ? width - characters : 0, ' ');
}

}  // namespace

void giveUp(const std::string &sentence) {
  std::fflush(stdout);
  (void)std::fprintf(stderr, "storix_bench: %s\n", sentence.c_str());
  std::exit(1);
}

double median(std::vector<double> values) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  const std::size_t half = values.size() / 2;
  return values.size() % 2 == 1 ? values[half] : std::midpoint(values[half - 1], values[half]);
}

double ratio(const Rounds &measured, const Rounds &floor) {
  std::vector<double> ratios;
  for (std::size_t i = 0; i < measured.size() && i < floor.size(); ++i) ratios.push_back(measured[i] / floor[i]);
  return median(std::move(ratios));
}

double nanosecondsOf(const std::function<void()> &work) {
  const auto start = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double, std::nano>(std::chrono::steady_clock::now() - start).count();
}

std::vector<Rounds> compare(const Extent &extent, const std::vector<Contestant> &contestants) {
  std::vector<std::size_t> times;
  times.reserve(contestants.size());
  for (const Contestant &contestant : contestants) times.push_back(timesPerSlice(contestant, extent.secondsPerRound()));
  return compareSlices(extent, contestants, times);
}

std::vector<Rounds> compareTimes(const Extent &extent, const std::vector<Contestant> &contestants, std::size_t times) {
  for (const Contestant &contestant : contestants) contestant.run(1);
  return compareSlices(extent, contestants, std::vector<std::size_t>(contestants.size(), times));
}

void pinToOneProcessor() {
  const cpu_set_t all = processorsAtStart();
  cpu_set_t one;
  CPU_ZERO(&one);
  // The last one: interrupts are mostly served by the first.
  for (std::size_t i = CPU_SETSIZE; i-- > 0;) {
    if (!CPU_ISSET(i, &all)) continue;
    CPU_SET(i, &one);
    break;
  }
  if (::sched_setaffinity(0, sizeof one, &one) != 0) giveUp("This process cannot be kept on one processor.");
}

void useAllProcessors() {
  const cpu_set_t all = processorsAtStart();
  if (::sched_setaffinity(0, sizeof all, &all) != 0) giveUp("This process cannot use its processors again.");
}

std::size_t processorCount() {
  const cpu_set_t all = processorsAtStart();
  return static_cast<std::size_t>(CPU_COUNT(&all));
}

void Table::section(std::string name) {
  std::printf("\n%s\n", padded(name, 0).c_str());
  std::printf("  %s %s %s %s %s %s\n", padded("", 62).c_str(), padded("measured", 12).c_str(),
              padded("floor", 44).c_str(), padded("ratio", 7).c_str(), padded("bound", 16).c_str(), "met");
  std::fflush(stdout);
  sections_.push_back({std::move(name), {}});
}

void Table::add(Figure figure) {
  if (extent_.quick) {
    figure.bound.clear();
    figure.met.reset();
  }
  const std::array<std::string, 5> line = cells(figure);
  std::printf("  %s %s %s %s %s %s\n", padded(figure.what, 62).c_str(), padded(line[0], 12).c_str(),
              padded(line[1], 44).c_str(), padded(line[2], 7).c_str(), padded(line[3], 16).c_str(), line[4].c_str());
  std::fflush(stdout);
  if (sections_.empty()) section("Figures");
  sections_.back().figures.push_back(std::move(figure));
}

void Table::plain(std::string what, const Rounds &rounds) {
  Figure figure;
  figure.what = std::move(what);
  figure.measured = median(rounds);
  add(std::move(figure));
}

void Table::against(std::string what, const Rounds &rounds, std::string floorName, const Rounds &floor,
                    std::optional<double> atMost) {
  Figure figure;
  figure.what = std::move(what);
  figure.measured = median(rounds);
  figure.floorName = std::move(floorName);
  figure.floor = median(floor);
  figure.ratio = ratio(rounds, floor);
  if (atMost) {
    figure.bound = "ratio ≤ " + text("%g", *atMost);
    figure.met = *figure.ratio <= *atMost;
  }
  add(std::move(figure));
}

std::string Table::markdown() const {
  std::string all;
  for (const Section &part : sections_) {
    all += "\n### " + part.name + "\n\n| | Measured | Floor | Ratio | Bound | Met |\n|---|---|---|---|---|---|\n";
    for (const Figure &figure : part.figures) {
      all += "| " + figure.what + " |";
      for (const std::string &cell : cells(figure)) all += " " + cell + " |";
      all += "\n";
    }
  }
  return all;
}

std::size_t Table::missedBounds() const {
  std::size_t missed = 0;
  for (const Section &part : sections_) {
    missed += static_cast<std::size_t>(std::count_if(part.figures.begin(), part.figures.end(),
                                                     [](const Figure &figure) { return figure.met == false; }));
  }
  return missed;
}

}  // namespace storix::bench
