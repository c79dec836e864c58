#pragma once

#include <optional>

#include "platform/URL.h"
#include "platform/Value.h"

namespace storix {

/// The hidden sibling of an item: the same directory, the last component with "." in front. Absent
/// when there is no such URL.
std::optional<URL> companionURLForURL(const std::optional<URL> &url);

/// Issues read-write tokens for an item's file and, whatever became of that, for its companion. Each
/// output is written when it is not null; token data is absent where no token could be issued. The
/// answer is true, always.
[[nodiscard]] bool issueItemSandboxTokens(const std::optional<URL> &url, std::optional<Data> *outTokenData,
                                          std::optional<URL> *outCompanionURL,
                                          std::optional<Data> *outCompanionTokenData);

}  // namespace storix
