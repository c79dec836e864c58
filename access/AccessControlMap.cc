#include "access/AccessControlMap.h"

#include <utility>

namespace storix {

namespace {

// The code of "this file does not hold what it should" in the domain of files.
constexpr std::int64_t wrongShapeCode = 1;

SXError wrongShape(const std::string &where, const Value &found, ValueKind expected) {
  std::string description = "The access control file has a " + std::string(valueKindName(found.kind())) + " " + where +
                            " where a " + std::string(valueKindName(expected)) + " should be.";
  return SXError(std::string(filesErrorDomain), wrongShapeCode, {{"description", std::move(description)}});
}

std::string quoted(std::string_view text) { return "“" + std::string(text) + "”"; }

// The entry of that key, put there with `empty` as its value if it is missing.
Value &entryFor(Dictionary &dictionary, std::string_view key, Value empty) {
  auto found = dictionary.find(key);
  if (found == dictionary.end()) found = dictionary.emplace(std::string(key), std::move(empty)).first;
  return found->second;
}

}  // namespace

Result<AccessControlMap> AccessControlMap::fromValue(Value content) {
  Dictionary *providers = content.dictionary();
  if (!providers) return wrongShape("at the top", content, ValueKind::dictionary);
  AccessControlMap map;
  for (const auto &[provider, providerEntry] : *providers) {
    const std::string thisProvider = "provider " + quoted(provider);
    const Dictionary *consumers = providerEntry.dictionary();
    if (!consumers) return wrongShape("for " + thisProvider, providerEntry, ValueKind::dictionary);
    for (const auto &[consumer, consumerEntry] : *consumers) {
      const std::string where = "for consumer " + quoted(consumer) + " of " + thisProvider;
      const Dictionary *fields = consumerEntry.dictionary();
      if (!fields) return wrongShape(where, consumerEntry, ValueKind::dictionary);
      const auto allowed = fields->find(allowedItemIDsKey);
      if (allowed == fields->end()) continue;
      const List *items = allowed->second.list();
      if (!items) return wrongShape("as AllowedItemIDs " + where, allowed->second, ValueKind::list);
      for (std::size_t i = 0; i < items->size(); ++i) {
        const std::string *item = (*items)[i].string();
        if (!item) {
          return wrongShape("as item " + std::to_string(i) + " of AllowedItemIDs " + where, (*items)[i],
                            ValueKind::string);
        }
        map.index_.insert(provider, *item, consumer);
      }
    }
  }
  map.dictionary_ = std::move(*providers);
  return map;
}

bool AccessControlMap::contains(const std::string &provider, const std::string &item,
                                const std::string &consumer) const {
  return index_.contains(provider, item, consumer);
}

bool AccessControlMap::add(const std::string &provider, const std::string &item, const std::string &consumer) {
  if (!index_.insert(provider, item, consumer)) return false;
  Dictionary &consumers = *entryFor(dictionary_, provider, Dictionary()).dictionary();
  Dictionary &fields = *entryFor(consumers, consumer, Dictionary()).dictionary();
  entryFor(fields, allowedItemIDsKey, List()).list()->emplace_back(item);
  return true;
}

bool AccessControlMap::remove(const std::string &provider, const std::string &item, const std::string &consumer) {
  if (!index_.erase(provider, item, consumer)) return false;

  // What the index held stands in the dictionary too.
  const auto providerEntry = dictionary_.find(provider);
  Dictionary &consumers = *providerEntry->second.dictionary();
  const auto consumerEntry = consumers.find(consumer);
  Dictionary &fields = *consumerEntry->second.dictionary();
  const auto allowed = fields.find(allowedItemIDsKey);
  List &items = *allowed->second.list();
  std::erase_if(items, [&item](const Value &value) { return *value.string() == item; });

  if (!items.empty()) return true;
  fields.erase(allowed);
  if (!fields.empty()) return true;
  consumers.erase(consumerEntry);
  if (consumers.empty()) dictionary_.erase(providerEntry);
  return true;
}

}  // namespace storix
