#pragma once

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace storix {

/// Which grants there are, for questions that come often. One flat table with a grant a slot, and a slot
/// a cache line: with many grants a question costs what it waits for memory, and here it waits once,
/// however the grants are spread. Owned by an AccessControlMap, and no more thread-safe than that.
class GrantIndex {
 public:
  [[nodiscard]] bool contains(const std::string &provider, std::string_view item, const std::string &consumer) const;

  /// False when it is there already.
  bool insert(const std::string &provider, std::string_view item, const std::string &consumer);

  /// False when it is not there.
  bool erase(const std::string &provider, std::string_view item, const std::string &consumer);

 private:
  /// Providers and consumers are few beside the items: a slot has their numbers, from 1. A number is
  /// kept when its last grant goes.
  using Numbers = std::unordered_map<std::string, std::uint32_t>;

  static constexpr std::size_t lineSize = 64;
  static constexpr std::size_t inlineLength = 40;

  /// A free slot has no provider.
  struct alignas(lineSize) Slot {
    std::uint32_t provider = 0;
    std::uint32_t consumer = 0;
    std::uint32_t fingerprint = 0;
    std::uint32_t beginLength = 0;
    std::array<char, inlineLength> begin{};
    std::unique_ptr<std::string> rest;
  };
  static_assert(sizeof(Slot) == lineSize);

  /// A grant as it is looked for.
  struct Sought {
    std::uint32_t provider;
    std::uint32_t consumer;
    std::string_view item;
    std::size_t hash;
  };

  static Sought sought(std::uint32_t provider, std::string_view item, std::uint32_t consumer);
  static std::uint32_t fingerprint(const Sought &grant);
  static bool holds(const Slot &slot, const Sought &grant);
  [[nodiscard]] std::size_t home(const Slot &slot) const;
  /// Where it stands, or the free slot where it would.
  [[nodiscard]] std::size_t positionOf(const Sought &grant) const;
  [[nodiscard]] std::size_t next(std::size_t position) const { return (position + 1) & (slots_.size() - 1); }
  void grow();

  Numbers providers_;
  Numbers consumers_;
  // A power of two, and never full; a grant stands at its home or behind it, with no free slot between.
  std::vector<Slot> slots_ = std::vector<Slot>(16);
  std::size_t count_ = 0;
};

}  // namespace storix
