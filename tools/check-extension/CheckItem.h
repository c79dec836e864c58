#pragma once

#include <optional>
#include <string>

#include "platform/URL.h"
#include "tools/check-extension/CheckedExtension.h"

namespace storix::check {

/// A document that the provider has, as its author names it: by its identifier, or by the path relative to
/// the provided-items directory.
struct KnownItem {
  std::optional<std::string> identifier;
  std::string path;
};

/// Has the document identified, provided, changed (it is not), dropped, and provided again after the process
/// was ended in the middle, and watches its file meanwhile. Gives its URL where there is one to go on with.
std::optional<URL> checkItem(CheckedExtension &extension, const KnownItem &item, const URL &storage);

/// The short form: has the document identified, provided and dropped once.
void checkThatItemIsServed(CheckedExtension &extension, const KnownItem &item, const URL &storage);

/// Has the extension do the same things over and over, and looks whether it keeps descriptors open.
void checkDescriptors(CheckedExtension &extension, const std::optional<URL> &item, const URL &storage);

}  // namespace storix::check
