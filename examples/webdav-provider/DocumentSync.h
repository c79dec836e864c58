#pragma once

#include <optional>
#include <stop_token>
#include <string>

#include "examples/webdav-provider/DavClient.h"
#include "examples/webdav-provider/ItemStates.h"
#include "examples/webdav-provider/LocalCopies.h"

namespace storix::example {

/// Makes a local file and the server's document the same, in either direction, and never at the cost
/// of content that is in one of the two places only.
///
/// What the two were when they last were the same is an ItemState, written after each step. Nothing
/// else tells what is still to be done: a local file with another content than the state says, or
/// without a state, has changes that are to be uploaded. So a process may end at any point: at worst
/// the next one finds a difference, asks the server, and sees that the contents are equal.
///
/// Made for one operation or several; the caller sees to it that nobody else works on the item.
class DocumentSync {
 public:
  DocumentSync(DavClient &client, const LocalCopies &copies, const ItemStates &states, std::stop_token cancellation)
      : client_(client), copies_(copies), states_(states), cancellation_(std::move(cancellation)) {}

  struct Outcome {
    std::optional<SXError> error;
    /// The local changes are kept in this item, which is to be uploaded as well.
    std::optional<std::string> conflict;
  };

  /// Has the document's content under the item's name: the server's newest, or the local file where
  /// that has changes (which are uploaded first), or where the server cannot be reached.
  Outcome provide(const std::string &path);

  /// Uploads the local file if it has changes. Where the server's document has changed as well, the
  /// local file is kept under a conflict name and the server's put in its place.
  Outcome upload(const std::string &path);

  /// Removes a local file that has no changes. EBUSY if it has.
  std::optional<SXError> evict(const std::string &path);

  /// Whether the local file may have changes, without reading it.
  [[nodiscard]] bool mayHaveChanges(const std::string &path) const;

 private:
  struct Fetched {
    Downloaded download;
    UniqueFd file;
    std::string hash;
  };

  Outcome uploadOnce(const std::string &path, bool &again);
  Outcome fetch(const std::string &path, const std::optional<ItemState> &clean,
                const std::optional<DavEntry> &announced = std::nullopt);
  Outcome settleConflict(const std::string &path, const std::string &localHash, const FileStamp &localStamp);
  /// Into the hidden file; absent file: unchanged. What there is after a failure is remembered. The
  /// progress is told in the placeholder of what the server has announced.
  Result<Fetched> download(const std::string &path, const std::string &knownETag,
                           const std::optional<DavEntry> &announced = std::nullopt);
  std::optional<SXError> remember(const std::string &path, const Fetched &fetched, const FileStamp &stamp);
  /// Where the server did not say of which version it spoke, it is asked for the version that it has now.
  /// One of another length is not the one, and the version stays unknown.
  void setVersion(ItemState &state, const std::string &path, const std::string &etag);

  DavClient &client_;
  const LocalCopies &copies_;
  const ItemStates &states_;
  const std::stop_token cancellation_;
};

/// Whether an error says that the server cannot be reached at the moment.
bool isUnreachable(const SXError &error);

}  // namespace storix::example
