#pragma once

#include <cstdint>
#include <optional>

#include "platform/URL.h"

namespace storix::ctl {

/// What a document's placeholder tells of the content that is not there yet.
struct Placeholder {
  std::optional<std::uint64_t> size;
  /// How much of it the provider has, while it is getting it.
  std::optional<std::uint64_t> received;
};

/// Reads the placeholder of a document, the hidden file beside it. Whatever is not one, or holds
/// something else, tells nothing. docs/placeholders.md has the form.
Placeholder readPlaceholder(const URL &document);

}  // namespace storix::ctl
