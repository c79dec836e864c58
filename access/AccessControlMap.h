#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_set>

#include "platform/Result.h"
#include "platform/Value.h"

namespace storix {

/// The grants: provider identifier -> consumer identifier -> "AllowedItemIDs" -> ordered list of
/// items. The dictionary is kept as the file has it, with the order of the lists and the keys that
/// nobody here knows; beside it stands an index, so that a question costs the same however many
/// grants there are and however they are spread. Not thread-safe: the store guards it.
class AccessControlMap {
 public:
  AccessControlMap() = default;

  /// The map that was read from a file; an error that says where, if it has another shape.
  static Result<AccessControlMap> fromValue(Value content);

  /// What is written to the file.
  [[nodiscard]] const Dictionary &dictionary() const { return dictionary_; }

  [[nodiscard]] bool contains(std::string_view provider, std::string_view item, std::string_view consumer) const;

  /// Appends the item to its list, making the levels that are missing. False when it stands there.
  bool add(const std::string &provider, const std::string &item, const std::string &consumer);

  /// Removes every occurrence of the item from its list, and then the levels that this left empty.
  /// False when it is not there.
  bool remove(const std::string &provider, const std::string &item, const std::string &consumer);

 private:
  struct Grant {
    std::string_view provider;
    std::string_view consumer;
    std::string_view item;
  };

  // A grant's three texts in one piece, so that comparing costs one look into memory.
  class StoredGrant {
   public:
    explicit StoredGrant(const Grant &grant);
    [[nodiscard]] bool is(const Grant &grant) const;
    [[nodiscard]] Grant grant() const;

   private:
    std::size_t providerLength_;
    std::size_t consumerLength_;
    std::string text_;
  };

  struct Hash {
    using is_transparent = void;
    std::size_t operator()(const Grant &grant) const;
    std::size_t operator()(const StoredGrant &stored) const { return (*this)(stored.grant()); }
  };
  struct Equal {
    using is_transparent = void;
    bool operator()(const StoredGrant &a, const StoredGrant &b) const { return a.is(b.grant()); }
    bool operator()(const Grant &a, const StoredGrant &b) const { return b.is(a); }
    bool operator()(const StoredGrant &a, const Grant &b) const { return a.is(b); }
  };

  Dictionary dictionary_;
  std::unordered_set<StoredGrant, Hash, Equal> index_;
};

}  // namespace storix
