#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "access/GrantIndex.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace storix {

/// Where the file with the grants lies: this directory below the user's home, and the name in it.
inline constexpr std::string_view accessControlDirectory = "Library/Storix";
inline constexpr std::string_view accessControlFileName = "AccessControl.kvs";

/// The grants: provider identifier -> consumer identifier -> "AllowedItemIDs" -> ordered list of
/// items. The dictionary is kept as the file has it, with the order of the lists and the keys that
/// nobody here knows; beside it stands an index, so that a question costs the same however many
/// grants there are and however they are spread. Not thread-safe: the store guards it.
class AccessControlMap {
 public:
  /// The key of a consumer's list.
  static constexpr std::string_view allowedItemIDsKey = "AllowedItemIDs";

  AccessControlMap() = default;

  /// The map that was read from a file; an error that says where, if it has another shape.
  static Result<AccessControlMap> fromValue(Value content);

  /// What is written to the file.
  [[nodiscard]] const Dictionary &dictionary() const { return dictionary_; }

  [[nodiscard]] bool contains(const std::string &provider, const std::string &item, const std::string &consumer) const;

  /// Appends the item to its list, making the levels that are missing. False when it stands there.
  bool add(const std::string &provider, const std::string &item, const std::string &consumer);

  /// Removes every occurrence of the item from its list, and then the levels that this left empty.
  /// False when it is not there.
  bool remove(const std::string &provider, const std::string &item, const std::string &consumer);

 private:
  Dictionary dictionary_;
  // What the lists hold.
  GrantIndex index_;
};

}  // namespace storix
