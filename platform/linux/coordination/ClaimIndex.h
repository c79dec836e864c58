#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace storix::linuxhost {

/// Which claims on paths exist, and which of them are held: a tree of path components. A claim is held
/// once no conflicting one that came before it, held or waiting, is left; so nobody overtakes. Claims
/// conflict when one of them is exclusive and their paths are the same or one lies below the other.
///
/// Adding and removing cost about the depth of the path times the logarithm of the claims below its
/// components, and not the number of claims. Holds no lock: its owner guards it.
class ClaimIndex {
 public:
  enum class Kind { shared, exclusive };

  /// Greater than that of every claim that came before; never 0.
  using Number = std::uint64_t;

  ClaimIndex();
  ~ClaimIndex();
  ClaimIndex(const ClaimIndex &) = delete;
  ClaimIndex &operator=(const ClaimIndex &) = delete;

  /// A new claim, the last to come. `path` is absolute, without "." and "..".
  Number add(std::string_view path, Kind kind);

  [[nodiscard]] bool isHeld(Number claim) const;

  /// Ends the claim, held or waiting; gives those that are held from now on, in the order in which they
  /// came. One that is unknown is ignored.
  std::vector<Number> remove(Number claim);

  [[nodiscard]] std::size_t size() const { return claims_.size(); }

  /// How many components a path has, the root included.
  static std::size_t componentsOf(std::string_view path);

 private:
  struct Node;
  struct Claim {
    Node *node;
    Kind kind;
    bool held;
  };

  Node *nodeFor(std::string_view path);
  void prune(Node *node);
  [[nodiscard]] bool isBlocked(Number number, const Claim &claim) const;
  void hold(Number number, Claim &claim, std::vector<Number> &nowHeld);
  void holdBetween(Number after, Number last, const std::set<Number> &waiting, std::vector<Number> &nowHeld);

  std::unique_ptr<Node> root_;
  Number last_ = 0;
  std::map<Number, Claim> claims_;
};

}  // namespace storix::linuxhost
