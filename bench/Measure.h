#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace storix::bench {

/// How much is measured. The quick form shows that everything still runs, and nothing else.
struct Extent {
  bool quick = false;
  /// Rounds of a comparison, each of which runs every contestant once.
  [[nodiscard]] std::size_t rounds() const { return quick ? 1 : 9; }
  /// About how long one contestant runs in one round.
  [[nodiscard]] double secondsPerRound() const { return quick ? 0.004 : 0.06; }
  [[nodiscard]] std::size_t times(std::size_t full, std::size_t whenQuick) const { return quick ? whenQuick : full; }
};

/// Something that is compared: does its operation so many times.
struct Contestant {
  std::string name;
  std::function<void(std::size_t times)> run;
};

/// What came of one contestant: nanoseconds an operation, one for each round.
using Rounds = std::vector<double>;

double median(std::vector<double> values);

/// The median of the rounds' ratios, each taken within its round.
double ratio(const Rounds &measured, const Rounds &floor);

/// Runs the contestants in turn, one slice of time each, and again, for as many rounds as the extent
/// says, so that what disturbs the machine disturbs all of them.
std::vector<Rounds> compare(const Extent &extent, const std::vector<Contestant> &contestants);

/// As `compare`, with a given number of operations in each slice.
std::vector<Rounds> compareTimes(const Extent &extent, const std::vector<Contestant> &contestants, std::size_t times);

/// The duration of one call.
double nanosecondsOf(const std::function<void()> &work);

/// This process, and those that it starts from now on, run on one processor, or again on all.
void pinToOneProcessor();
void useAllProcessors();
std::size_t processorCount();

/// Ends the benchmark with a sentence: what it measures does not work.
[[noreturn]] void giveUp(const std::string &sentence);

enum class Unit { nanoseconds, callsPerSecond, bytes };

/// One line of the table. Where there is a bound, `met` says whether it holds.
struct Figure {
  std::string what;
  Unit unit = Unit::nanoseconds;
  double measured = 0;
  std::string floorName;
  std::optional<double> floor;
  std::optional<double> ratio;
  std::string bound;
  std::optional<bool> met;
};

/// The figures, as they come and all together. Used by the main thread.
class Table {
 public:
  explicit Table(Extent extent) : extent_(extent) {}

  void section(std::string name);
  /// Prints the line at once.
  void add(Figure figure);

  /// A floor or a figure that stands for itself.
  void plain(std::string what, const Rounds &rounds);
  /// Compared with a floor; `atMost` bounds the ratio.
  void against(std::string what, const Rounds &rounds, std::string floorName, const Rounds &floor,
               std::optional<double> atMost = std::nullopt);

  [[nodiscard]] const Extent &extent() const { return extent_; }
  [[nodiscard]] std::string markdown() const;
  [[nodiscard]] std::size_t missedBounds() const;

 private:
  struct Section {
    std::string name;
    std::vector<Figure> figures;
  };

  const Extent extent_;
  std::vector<Section> sections_;
};

}  // namespace storix::bench
