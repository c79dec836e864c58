#pragma once

#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "wire/Signature.h"

namespace storix::wire {

/// The introspection XML of one object: its interfaces, those that every object has, and the names of
/// the objects directly below it.
std::string introspectionXML(std::span<const InterfaceDescription *const> interfaces,
                             std::span<const std::string> children);

/// The first components, without repetition, of those of the paths that lie below `path`.
std::vector<std::string> childrenOf(std::string_view path, std::span<const std::string_view> objectPaths);

}  // namespace storix::wire
