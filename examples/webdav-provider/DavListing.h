#pragma once

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.h"

namespace storix::example {

/// What a server tells of one document or collection.
struct DavEntry {
  /// Relative to the collection that was asked for, decoded; empty for that itself.
  std::string path;
  bool isCollection = false;
  std::optional<std::int64_t> size;
  /// As the server writes it: quoted, with W/ in front where it is a weak one. Empty: none.
  std::string etag;
  std::optional<time_t> modificationTime;

  /// Something that is another text whenever the content is another, as far as the server tells: the
  /// etag without its weakness, or where there is none, size and time.
  [[nodiscard]] std::string version() const;
};

/// Reads the answer to a PROPFIND (a "multistatus" document) for the collection or document at
/// `requestPath`, an absolute decoded path.
///
/// Properties count only under a status of success. References outside of the collection are left
/// out, and those that could lead astray. A server behind a proxy may write all its references with
/// another prefix; then the shortest, if all others lie below it, stands for what was asked for.
/// Names are compared with their XML namespace. A document type is refused, so that nothing can be
/// expanded or fetched; so is what is no XML. Errors: EPROTO, with the line. Thread-safe.
Result<std::vector<DavEntry>> readMultistatus(std::string_view text, const std::string &requestPath);

/// The etag without W/ in front, which says only how sure the server is.
std::string_view withoutWeakness(std::string_view etag);

}  // namespace storix::example
