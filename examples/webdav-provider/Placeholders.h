#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "examples/webdav-provider/DavListing.h"
#include "examples/webdav-provider/LocalCopies.h"

namespace storix::example {

/// The text of an item's placeholder: a keyed-value file with "etag", "modificationTime" (seconds since
/// 1970), "name", "received" and "size", each where it is known. None where the name is not UTF-8.
std::optional<std::string> placeholderText(const std::string &name, const DavEntry &entry,
                                           std::optional<std::int64_t> received = std::nullopt);

/// Writes the placeholder beside the item and gives its path. An application may keep a file of its own
/// in that place: what is there and is no placeholder stays, and the error is EEXIST.
Result<std::string> writePlaceholder(const LocalCopies &copies, const std::string &path, const DavEntry &entry,
                                     std::optional<std::int64_t> received = std::nullopt);

/// Tells in the placeholder how far a download is, now and then, and tells nothing of it any more when
/// this goes out of scope. Where the placeholder cannot be written nobody is told. One thread.
class ProgressInPlaceholder {
 public:
  ProgressInPlaceholder(const LocalCopies &copies, std::string path, DavEntry entry, std::chrono::milliseconds interval)
      : copies_(copies), path_(std::move(path)), entry_(std::move(entry)), interval_(interval) {}
  ~ProgressInPlaceholder();
  ProgressInPlaceholder(const ProgressInPlaceholder &) = delete;
  ProgressInPlaceholder &operator=(const ProgressInPlaceholder &) = delete;

  void arrived(std::int64_t received);

 private:
  using Clock = std::chrono::steady_clock;

  const LocalCopies &copies_;
  const std::string path_;
  const DavEntry entry_;
  const std::chrono::milliseconds interval_;
  Clock::time_point last_ = Clock::now();
  bool told_ = false;
};

}  // namespace storix::example
