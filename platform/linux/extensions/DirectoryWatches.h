#pragma once

#include <cstddef>
#include <map>
#include <set>
#include <span>
#include <string>
#include <vector>

#include "platform/SXError.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// Which entries of directories are of interest, and whether one of them has changed. A directory that
/// is not there, or not readable, is watched by its nearest parent that is. Belongs to one thread at a time.
///
/// Each look at the directories is one round: `beginRound`, then `watch` for each directory right
/// before it is read, then `endRound`, which lets go of what was not named in this round.
class DirectoryWatches {
 public:
  /// Tells of failures through `endRound`.
  DirectoryWatches();

  /// Readable when something has happened; -1 when the kernel gave none.
  [[nodiscard]] int fd() const { return inotify_.get(); }

  void beginRound();

  /// `names` are those of the entries that matter; a name that begins with "*" stands for every name
  /// that ends in the rest of it.
  void watch(const std::string &directory, const std::string &name);

  /// What could not be watched in this round.
  std::vector<SXError> endRound();

  /// Reads what has happened; true when something of interest has changed, or may have.
  bool readChanges();

  /// The same for events that were read already.
  bool wantsLook(std::span<const std::byte> events);

 private:
  using Names = std::set<std::string>;

  /// The watch descriptor, or the errno as a negative number.
  int add(const std::string &directory, const std::string &name);
  [[nodiscard]] bool isOfInterest(int watch, const char *name) const;

  UniqueFd inotify_;
  int openError_ = 0;
  std::map<int, Names> watches_;
  std::map<int, Names> round_;
  std::vector<SXError> problems_;
};

}  // namespace storix::linuxhost
