#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/SXError.h"
#include "platform/Value.h"

namespace storix::ctl {

/// The JSON text of a dictionary, keys in order, and a line's end. URLs become their text, byte
/// buffers their base64 text, errors objects with "domain", "code", "message" and "details". In
/// texts that are not UTF-8 every byte beyond ASCII becomes "?".
std::string jsonText(const Dictionary &dictionary);

/// Tokens on the command line and in JSON.
std::string base64(const Data &data);
std::optional<Data> fromBase64(std::string_view text);

}  // namespace storix::ctl
