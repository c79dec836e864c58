#include "access/GrantIndex.h"

#include <algorithm>
#include <utility>

namespace storix {

namespace {

// Of five slots four may be taken: beyond that, the way to a free slot grows quickly.
constexpr std::size_t slotsOfShare = 5;
constexpr std::size_t takenOfShare = 4;

std::uint32_t numberOf(const std::unordered_map<std::string, std::uint32_t> &numbers, const std::string &name) {
  const auto found = numbers.find(name);
  return found == numbers.end() ? 0 : found->second;
}

std::uint32_t newNumberOf(std::unordered_map<std::string, std::uint32_t> &numbers, const std::string &name) {
  return numbers.try_emplace(name, static_cast<std::uint32_t>(numbers.size() + 1)).first->second;
}

}  // namespace

GrantIndex::Sought GrantIndex::sought(std::uint32_t provider, std::string_view item, std::uint32_t consumer) {
  constexpr std::uint64_t oddAndWide = 0x9E3779B97F4A7C15;
  const std::uint64_t list = ((std::uint64_t{provider} << 32U) | consumer) * oddAndWide;
  return {provider, consumer, item, std::hash<std::string_view>()(item) ^ (list ^ (list >> 32U))};
}

// A home is found by it too, so a table has at most 2^32 slots: four gibibytes of them are 2^26.
std::uint32_t GrantIndex::fingerprint(const Sought &grant) { return static_cast<std::uint32_t>(grant.hash); }

bool GrantIndex::holds(const Slot &slot, const Sought &grant) {
  if (slot.fingerprint != fingerprint(grant) || slot.provider != grant.provider || slot.consumer != grant.consumer) {
    return false;
  }
  const std::string_view begin(slot.begin.data(), slot.beginLength);
  if (begin != grant.item.substr(0, inlineLength)) return false;
  const std::string_view rest = slot.rest ? std::string_view(*slot.rest) : std::string_view();
  return rest == grant.item.substr(begin.size());
}

std::size_t GrantIndex::home(const Slot &slot) const { return slot.fingerprint & (slots_.size() - 1); }

std::size_t GrantIndex::positionOf(const Sought &grant) const {
  std::size_t position = fingerprint(grant) & (slots_.size() - 1);
  while (slots_[position].provider != 0 && !holds(slots_[position], grant)) position = next(position);
  return position;
}

bool GrantIndex::contains(const std::string &provider, std::string_view item, const std::string &consumer) const {
  const std::uint32_t providerNumber = numberOf(providers_, provider);
  const std::uint32_t consumerNumber = numberOf(consumers_, consumer);
  if (providerNumber == 0 || consumerNumber == 0) return false;
  return slots_[positionOf(sought(providerNumber, item, consumerNumber))].provider != 0;
}

bool GrantIndex::insert(const std::string &provider, std::string_view item, const std::string &consumer) {
  if ((count_ + 1) * slotsOfShare > slots_.size() * takenOfShare) grow();
  const Sought grant = sought(newNumberOf(providers_, provider), item, newNumberOf(consumers_, consumer));
  Slot &slot = slots_[positionOf(grant)];
  if (slot.provider != 0) return false;
  const std::string_view begin = item.substr(0, inlineLength);
  slot.provider = grant.provider;
  slot.consumer = grant.consumer;
  slot.fingerprint = fingerprint(grant);
  slot.beginLength = static_cast<std::uint32_t>(begin.size());
  std::ranges::copy(begin, slot.begin.begin());
  if (begin.size() < item.size()) slot.rest = std::make_unique<std::string>(item.substr(begin.size()));
  ++count_;
  return true;
}

bool GrantIndex::erase(const std::string &provider, std::string_view item, const std::string &consumer) {
  const std::uint32_t providerNumber = numberOf(providers_, provider);
  const std::uint32_t consumerNumber = numberOf(consumers_, consumer);
  if (providerNumber == 0 || consumerNumber == 0) return false;
  std::size_t freed = positionOf(sought(providerNumber, item, consumerNumber));
  if (slots_[freed].provider == 0) return false;
  // Those behind move up, unless their home lies behind the freed slot.
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t at = next(freed); slots_[at].provider != 0; at = next(at)) {
    const std::size_t fromHome = (at - home(slots_[at])) & mask;
    if (fromHome < ((at - freed) & mask)) continue;
    slots_[freed] = std::move(slots_[at]);
    freed = at;
  }
  slots_[freed] = Slot();
  --count_;
  return true;
}

void GrantIndex::grow() {
  std::vector<Slot> old(slots_.size() * 2);
  old.swap(slots_);
  for (Slot &slot : old) {
    if (slot.provider == 0) continue;
    std::size_t position = home(slot);
    while (slots_[position].provider != 0) position = next(position);
    slots_[position] = std::move(slot);
  }
}

}  // namespace storix
