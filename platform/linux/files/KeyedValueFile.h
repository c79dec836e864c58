#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/Result.h"
#include "platform/SXError.h"
#include "platform/Value.h"

namespace storix::linuxhost {

/// Keyed-value text: one JSON object of objects, arrays, strings, numbers and booleans, in UTF-8.
/// docs/keyed-value-files.md has the grammar. The functions hold no state and may be called from any
/// thread.
///
/// Refused, with the line, the column and the byte in the error's description: what is not JSON, text
/// after the object, a root that is no object, null, a key that stands twice in one object, more than
/// 64 levels, a file of more than 256 MiB, text that is not UTF-8.
inline constexpr std::size_t keyedValueNestingLimit = 64;
inline constexpr std::size_t keyedValueSizeLimit = std::size_t{256} << 20;

/// Text that is not keyed-value text has this code in `filesErrorDomain`; a failure to read or write
/// it is a "posix" error.
inline constexpr std::int64_t keyedValueFormatErrorCode = 2;

/// For whoever finds something wrong in what such a text says.
inline SXError keyedValueFormatError(std::string reason) {
  return SXError(std::string(filesErrorDomain), keyedValueFormatErrorCode, {{"description", Value(std::move(reason))}});
}

/// Reads from where the descriptor stands to the end. `name` is what error texts call it.
Result<Dictionary> readKeyedValues(int fd, std::string_view name, std::size_t sizeLimit = keyedValueSizeLimit);

/// Opens and reads a regular file; never waits for a FIFO's other end.
Result<Dictionary> readKeyedValueFile(const std::string &path);

Result<Dictionary> parseKeyedValues(std::string_view text, std::string_view name);

/// The text of the dictionary: the same content gives the same bytes. Refused: URLs, byte buffers and
/// errors, numbers that are not finite, strings that are not UTF-8, and what could not be read back.
Result<std::string> keyedValueText(const Dictionary &content);

/// What becomes of the file that the new one replaces.
enum class PreviousFile { dropped, keptAsCorrupt };

/// Puts a file with that content, mode 0600, in the place of what is at the path, or leaves that as
/// it was. None when the new file is safely on the disk. With `keptAsCorrupt` the previous file gets
/// the name "<name>.corrupt" first, in place of an earlier one.
///
/// Writers of the same path, in this process or another, wait for each other.
[[nodiscard]] std::optional<SXError> writeKeyedValueFile(const Dictionary &content, const std::string &path,
                                                         PreviousFile previous = PreviousFile::dropped);

}  // namespace storix::linuxhost
