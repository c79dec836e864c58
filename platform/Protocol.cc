#include "platform/Protocol.h"

#include <algorithm>

namespace storix {

const OperationDescription *ProtocolDescription::operationNamed(std::string_view wanted) const {
  const auto found = std::find_if(operations.begin(), operations.end(), [wanted](const OperationDescription &row) {
    return row.name == wanted || row.method == wanted;
  });
  return found == operations.end() ? nullptr : &*found;
}

bool holdsOnlyKinds(const Value &value, const std::set<ValueKind> &kinds) {
  const auto isPermitted = [&kinds](const Value &inside) {
    return kinds.contains(inside.kind()) && holdsOnlyKinds(inside, kinds);
  };
  if (const List *list = value.list()) return std::all_of(list->begin(), list->end(), isPermitted);
  if (const Dictionary *dictionary = value.dictionary()) {
    return std::all_of(dictionary->begin(), dictionary->end(),
                       [&isPermitted](const auto &entry) { return isPermitted(entry.second); });
  }
  return true;
}

void LinkInterface::setPermittedKinds(std::set<ValueKind> kinds, std::string_view operationName,
                                      std::size_t argumentIndex, bool ofReply) {
  permittedKinds_.insert_or_assign({std::string(operationName), argumentIndex, ofReply}, std::move(kinds));
}

const std::set<ValueKind> *LinkInterface::permittedKinds(std::string_view operationName, std::size_t argumentIndex,
                                                         bool ofReply) const {
  // There are very few, and looking for a key would copy the name for each argument of each message.
  const auto found = std::find_if(permittedKinds_.begin(), permittedKinds_.end(),
                                  [&operationName, &argumentIndex, &ofReply](const auto &declared) {
                                    return declared.first == std::tie(operationName, argumentIndex, ofReply);
                                  });
  return found == permittedKinds_.end() ? nullptr : &found->second;
}

}  // namespace storix
