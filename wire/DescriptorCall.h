#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "wire/BusTarget.h"

namespace storix::wire {

/// A message that came with one file descriptor, written anew: none unless it is a call with one
/// descriptor of a method that takes one, of which `takesDescriptor` tells (its arguments live as long
/// as that call). Only what such a call needs goes over, so that sd-bus, which keeps the descriptor of
/// a message that it drops, has nothing to find fault with. The body stays as it is.
std::optional<std::string> rewrittenDescriptorCall(
    std::string_view message,
    const std::function<bool(const BusTarget &target, std::string_view signature)> &takesDescriptor);

}  // namespace storix::wire
