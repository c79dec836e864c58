#include "examples/webdav-provider/DocumentSync.h"

#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <utility>

#include "examples/webdav-provider/ContentHash.h"
#include "examples/webdav-provider/Placeholders.h"

namespace storix::example {

namespace {

constexpr int uploadsAtMost = 6;

/// Many servers are sure of a version only when it is more than a second old.
constexpr std::chrono::milliseconds untilSure{1100};
constexpr int waitsForSureness = 2;

/// Not where the server's answers do not fit what is there, and not where there is no room for it.
bool canGoOnAfter(const SXError &error) {
  switch (error.code()) {
    case EPROTO:
    case ENOSPC:
    case EDQUOT:
    case EFBIG:
      return false;
    default:
      return true;
  }
}

bool isWeak(const std::string &etag) { return etag.starts_with("W/"); }

}  // namespace

bool isUnreachable(const SXError &error) {
  if (error.domain() != posixErrorDomain) return false;
  switch (error.code()) {
    case EHOSTUNREACH:
    case ECONNREFUSED:
    case ECONNRESET:
    case ETIMEDOUT:
    case EREMOTEIO:
      return true;
    default:
      return false;
  }
}

DocumentSync::Outcome DocumentSync::provide(const std::string &path) {
  auto local = copies_.find(path);
  if (!local) return {local.error(), {}};
  auto state = states_.read(path);
  if (local.value()) {
    const FileStamp stamp = local.value()->stamp;
    local.value().reset();
    if (!state || state->hash.empty() || stamp != state->stamp) {
      Outcome uploaded = upload(path);
      // Nobody has anything newer than the local file.
      if (uploaded.error && isUnreachable(*uploaded.error)) uploaded.error.reset();
      if (uploaded.error || uploaded.conflict) return uploaded;
      state = states_.read(path);
    }
    Outcome fetched = fetch(path, state);
    if (fetched.error && isUnreachable(*fetched.error)) fetched.error.reset();
    return fetched;
  }
  const auto remote = client_.entry(path, cancellation_);
  if (!remote) return {remote.error(), {}};
  if (!remote.value()) return {posixError(ENOENT, "looking for \"" + path + "\" on the server"), {}};
  if (remote.value()->isCollection) return {posixError(EISDIR, "downloading \"" + path + "\""), {}};
  return fetch(path, std::nullopt, remote.value());
}

DocumentSync::Outcome DocumentSync::fetch(const std::string &path, const std::optional<ItemState> &clean,
                                          const std::optional<DavEntry> &announced) {
  auto fetched = download(path, clean ? clean->etag : "", announced);
  if (!fetched) return {fetched.error(), {}};
  if (fetched.value().download.isUnchanged) return {};
  auto replacing = LocalCopies::Replacing::no;
  auto local = copies_.find(path);
  if (!local) return {local.error(), {}};
  if (local.value()) {
    const auto hash = ContentHash::ofFile(local.value()->descriptor.get());
    if (!hash) return {hash.error(), {}};
    if (hash.value() == fetched.value().hash) {
      copies_.discardPartial(path);
      return {remember(path, fetched.value(), local.value()->stamp), {}};
    }
    // It was changed while the download went on.
    if (!clean || hash.value() != clean->hash) return upload(path);
    replacing = LocalCopies::Replacing::yes;
  }
  auto stamp = copies_.place(path, fetched.value().file.get(), fetched.value().download.modificationTime, replacing);
  if (!stamp) return stamp.error().code() == EEXIST ? upload(path) : Outcome{stamp.error(), {}};
  return {remember(path, fetched.value(), stamp.value()), {}};
}

DocumentSync::Outcome DocumentSync::upload(const std::string &path) {
  for (int attempt = 0; attempt < uploadsAtMost; ++attempt) {
    bool again = false;
    Outcome outcome = uploadOnce(path, again);
    if (!again) return outcome;
    if (cancellation_.stop_requested()) return {posixError(ECANCELED, "uploading \"" + path + "\""), {}};
  }
  return {posixError(EAGAIN, "uploading \"" + path + "\" (it changes all the time, here or on the server)"), {}};
}

DocumentSync::Outcome DocumentSync::uploadOnce(const std::string &path, bool &again) {
  auto local = copies_.find(path);
  if (!local) return {local.error(), {}};
  if (!local.value()) return {posixError(ENOENT, "uploading \"" + path + "\""), {}};
  const int file = local.value()->descriptor.get();
  const FileStamp stamp = local.value()->stamp;
  const auto hash = ContentHash::ofFile(file);
  if (!hash) return {hash.error(), {}};
  const auto state = states_.read(path);
  if (state && state->hash == hash.value()) {
    if (state->stamp == stamp) return {};
    ItemState same = *state;
    same.stamp = stamp;
    return {states_.write(path, same), {}};
  }

  std::optional<DavEntry> remote;
  for (int waits = 0;; ++waits) {
    auto found = client_.entry(path, cancellation_);
    if (!found) return {found.error(), {}};
    remote = std::move(found.value());
    if (!remote) break;
    if (remote->isCollection) return {posixError(EISDIR, "uploading \"" + path + "\""), {}};
    if (!state || state->version.empty() || remote->version() != state->version) {
      return settleConflict(path, hash.value(), stamp);
    }
    if (!isWeak(remote->etag) || waits == waitsForSureness) break;
    DavClient::pause(untilSure, cancellation_);
  }

  const std::string condition = remote ? DavClient::onlyOver(*remote) : DavClient::onlyWhereNothingIs();
  const auto uploaded = client_.upload(path, file, stamp.size, condition, cancellation_);
  if (!uploaded) return {uploaded.error(), {}};
  if (uploaded.value().preconditionFailed) {
    again = true;
    return {};
  }
  ItemState done;
  done.hash = uploaded.value().hash;
  done.stamp = stamp;
  setVersion(done, path, uploaded.value().etag);
  if (auto failed = states_.write(path, done)) return {failed, {}};
  const auto after = copies_.find(path);
  again = after && after.value() && after.value()->stamp != stamp;
  return {};
}

DocumentSync::Outcome DocumentSync::settleConflict(const std::string &path, const std::string &localHash,
                                                   const FileStamp &localStamp) {
  auto fetched = download(path, "");
  if (!fetched) return {fetched.error(), {}};
  if (fetched.value().hash == localHash) {
    copies_.discardPartial(path);
    return {remember(path, fetched.value(), localStamp), {}};
  }
  // First the second name, then the server's document under the first: so both are there at any time.
  auto kept = copies_.keepUnderConflictName(path);
  if (!kept) return {kept.error(), {}};
  const auto stamp = copies_.place(path, fetched.value().file.get(), fetched.value().download.modificationTime,
                                   LocalCopies::Replacing::yes);
  if (!stamp) return {stamp.error(), std::move(kept.value())};
  return {remember(path, fetched.value(), stamp.value()), std::move(kept.value())};
}

std::optional<SXError> DocumentSync::evict(const std::string &path) {
  auto local = copies_.find(path);
  if (!local) return local.error();
  if (local.value()) {
    const auto hash = ContentHash::ofFile(local.value()->descriptor.get());
    if (!hash) return hash.error();
    const auto state = states_.read(path);
    if (!state || state->hash != hash.value()) {
      return posixError(EBUSY, "dropping \"" + path + "\" (it has changes that the server does not have yet)");
    }
    if (auto failed = copies_.remove(path)) return failed;
  }
  copies_.discardPartial(path);
  return states_.remove(path);
}

bool DocumentSync::mayHaveChanges(const std::string &path) const {
  const auto local = copies_.find(path);
  if (!local || !local.value()) return false;
  const auto state = states_.read(path);
  return !state || state->stamp != local.value()->stamp;
}

Result<DocumentSync::Fetched> DocumentSync::download(const std::string &path, const std::string &knownETag,
                                                     const std::optional<DavEntry> &announced) {
  ItemState state = states_.read(path).value_or(ItemState{});
  auto file = copies_.openPartial(path, state.partialLength);
  if (!file) return file.error();
  std::optional<ProgressInPlaceholder> progress;
  PartialDownload partial{file.value().get(), state.partialETag, state.partialLength, {}};
  if (announced) {
    progress.emplace(copies_, path, *announced, client_.settings().progressInterval);
    partial.grown = [&progress](std::int64_t length) { progress->arrived(length); };
  }
  if (::lseek(partial.file, 0, SEEK_END) != partial.length) {
    partial.length = 0;
    partial.etag.clear();
  }
  auto downloaded = client_.download(path, knownETag, partial, cancellation_);
  if (!downloaded) {
    const bool keep = canGoOnAfter(downloaded.error()) && ::fdatasync(partial.file) == 0;
    state.partialETag = keep ? partial.etag : "";
    state.partialLength = keep ? partial.length : 0;
    if (states_.write(path, state) || !keep) copies_.discardPartial(path);
    return downloaded.error();
  }
  if (downloaded.value().isUnchanged) {
    copies_.discardPartial(path);
    return Fetched{std::move(downloaded.value()), {}, ""};
  }
  auto hash = ContentHash::ofFile(partial.file);
  if (!hash) return hash.error();
  return Fetched{std::move(downloaded.value()), std::move(file.value()), std::move(hash.value())};
}

std::optional<SXError> DocumentSync::remember(const std::string &path, const Fetched &fetched, const FileStamp &stamp) {
  ItemState state;
  state.hash = fetched.hash;
  state.stamp = stamp;
  setVersion(state, path, fetched.download.etag);
  return states_.write(path, state);
}

void DocumentSync::setVersion(ItemState &state, const std::string &path, const std::string &etag) {
  state.etag = etag;
  state.version = withoutWeakness(etag);
  if (!etag.empty()) return;
  const auto now = client_.entry(path, cancellation_);
  if (!now || !now.value() || now.value()->size != state.stamp.size) return;
  state.etag = now.value()->etag;
  state.version = now.value()->version();
}

}  // namespace storix::example
