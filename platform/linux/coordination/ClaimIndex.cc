#include "platform/linux/coordination/ClaimIndex.h"

#include <algorithm>

namespace storix::linuxhost {

namespace {

/// Takes the first component off the path; empty when there is none left.
std::string_view takeComponent(std::string_view &path) {
  while (path.starts_with('/')) path.remove_prefix(1);
  const std::string_view component = path.substr(0, path.find('/'));
  path.remove_prefix(component.size());
  return component;
}

/// Whether the set has a member before that number.
bool hasBefore(const std::set<ClaimIndex::Number> &numbers, ClaimIndex::Number number) {
  return !numbers.empty() && *numbers.begin() < number;
}

}  // namespace

/// One component of a path that some claim has. What stands here counts the claims on this very path
/// (own) and on it and everything below it (tree).
struct ClaimIndex::Node {
  Node *parent = nullptr;
  std::string name;
  std::map<std::string, std::unique_ptr<Node>, std::less<>> children;
  std::set<Number> own;
  std::set<Number> ownExclusive;
  std::set<Number> ownWaiting;
  std::set<Number> tree;
  std::set<Number> treeExclusive;
  std::set<Number> treeWaitingShared;
  std::set<Number> treeWaitingExclusive;

  std::set<Number> &treeWaiting(Kind kind) { return kind == Kind::shared ? treeWaitingShared : treeWaitingExclusive; }
};

ClaimIndex::ClaimIndex() : root_(std::make_unique<Node>()) {}

ClaimIndex::~ClaimIndex() {
  // From the leaves up, so that a deep path costs no deep stack.
  while (!claims_.empty()) remove(claims_.rbegin()->first);
}

std::size_t ClaimIndex::componentsOf(std::string_view path) {
  std::size_t count = 1;
  while (!takeComponent(path).empty()) ++count;
  return count;
}

ClaimIndex::Node *ClaimIndex::nodeFor(std::string_view path) {
  Node *node = root_.get();
  for (std::string_view name = takeComponent(path); !name.empty(); name = takeComponent(path)) {
    auto child = node->children.find(name);
    if (child == node->children.end()) {
      child = node->children.emplace(std::string(name), std::make_unique<Node>()).first;
      child->second->parent = node;
      child->second->name = name;
    }
    node = child->second.get();
  }
  return node;
}

void ClaimIndex::prune(Node *node) {
  while (node->parent && node->tree.empty()) {
    Node *parent = node->parent;
    parent->children.erase(parent->children.find(node->name));
    node = parent;
  }
}

ClaimIndex::Number ClaimIndex::add(std::string_view path, Kind kind) {
  const Number number = ++last_;
  Node *own = nodeFor(path);
  Claim &claim = claims_.emplace(number, Claim{own, kind, false}).first->second;
  own->own.insert(number);
  if (kind == Kind::exclusive) own->ownExclusive.insert(number);
  for (Node *node = own; node; node = node->parent) {
    node->tree.insert(number);
    if (kind == Kind::exclusive) node->treeExclusive.insert(number);
  }
  claim.held = !isBlocked(number, claim);
  if (!claim.held) {
    own->ownWaiting.insert(number);
    for (Node *node = own; node; node = node->parent) node->treeWaiting(kind).insert(number);
  }
  return number;
}

bool ClaimIndex::isHeld(Number claim) const {
  const auto found = claims_.find(claim);
  return found != claims_.end() && found->second.held;
}

bool ClaimIndex::isBlocked(Number number, const Claim &claim) const {
  const bool exclusive = claim.kind == Kind::exclusive;
  if (hasBefore(exclusive ? claim.node->tree : claim.node->treeExclusive, number)) return true;
  for (const Node *node = claim.node->parent; node; node = node->parent) {
    if (hasBefore(exclusive ? node->own : node->ownExclusive, number)) return true;
  }
  return false;
}

void ClaimIndex::hold(Number number, Claim &claim, std::vector<Number> &nowHeld) {
  claim.held = true;
  claim.node->ownWaiting.erase(number);
  for (Node *node = claim.node; node; node = node->parent) node->treeWaiting(claim.kind).erase(number);
  nowHeld.push_back(number);
}

/// Holds those of the waiting claims, after one number and not after another, that nothing blocks.
void ClaimIndex::holdBetween(Number after, Number last, const std::set<Number> &waiting, std::vector<Number> &nowHeld) {
  for (auto next = waiting.upper_bound(after); next != waiting.end() && *next <= last;) {
    const Number candidate = *next;
    Claim &claim = claims_.find(candidate)->second;
    if (!isBlocked(candidate, claim)) hold(candidate, claim, nowHeld);
    next = waiting.upper_bound(candidate);
  }
}

std::vector<ClaimIndex::Number> ClaimIndex::remove(Number number) {
  std::vector<Number> nowHeld;
  const auto found = claims_.find(number);
  if (found == claims_.end()) return nowHeld;
  Node *const place = found->second.node;
  const Kind kind = found->second.kind;
  claims_.erase(found);
  place->own.erase(number);
  place->ownExclusive.erase(number);
  place->ownWaiting.erase(number);
  for (Node *node = place; node; node = node->parent) {
    node->tree.erase(number);
    node->treeExclusive.erase(number);
    node->treeWaiting(kind).erase(number);
  }

  // Those that wait above this path: where one of them is blocked, so is every later one on its path.
  for (Node *node = place->parent; node; node = node->parent) {
    while (!node->ownWaiting.empty()) {
      const Number first = *node->ownWaiting.begin();
      Claim &claim = claims_.find(first)->second;
      if (isBlocked(first, claim)) break;
      hold(first, claim, nowHeld);
    }
  }
  // Those that wait on it and below it. What is still claimed on the path itself, or above it, bounds
  // the search, so that no claim is looked at again for each one that ends before its time has come.
  Number firstOfAny = last_ + 1;
  Number firstExclusive = last_ + 1;
  for (Node *node = place; node; node = node->parent) {
    if (!node->own.empty()) firstOfAny = std::min(firstOfAny, *node->own.begin());
    if (!node->ownExclusive.empty()) firstExclusive = std::min(firstExclusive, *node->ownExclusive.begin());
  }
  holdBetween(number, firstOfAny, place->treeWaitingExclusive, nowHeld);
  if (kind == Kind::exclusive) holdBetween(number, firstExclusive, place->treeWaitingShared, nowHeld);
  prune(place);
  std::sort(nowHeld.begin(), nowHeld.end());
  return nowHeld;
}

}  // namespace storix::linuxhost
