#pragma once

#include <sodium.h>

#include <memory>
#include <string>
#include <string_view>

#include "platform/Result.h"

namespace storix::example {

/// A hash of a document's content or of a name, by which equal ones are known. One thread at a time.
class ContentHash {
 public:
  ContentHash() { reset(); }

  void reset();
  void add(std::string_view bytes);
  /// Hexadecimal. Once, after everything was added.
  std::string finish();

  static std::string of(std::string_view text);
  /// Of a file from its beginning to its end.
  static Result<std::string> ofFile(int file);

 private:
  crypto_generichash_state state_;
};

}  // namespace storix::example
