#pragma once

#include <string>
#include <string_view>

#include "platform/Log.h"

namespace storix::linuxhost {

/// A path for an error's description: quoted, and UTF-8 whatever bytes the name is made of.
inline std::string quotedPath(std::string_view path) { return "“" + escapedForLog(path) + "”"; }

}  // namespace storix::linuxhost
