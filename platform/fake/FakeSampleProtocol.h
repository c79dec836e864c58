#pragma once

#include <string>

#include "platform/ProtocolTable.h"

namespace storix::fake {

/// A small protocol for the tests of the fake host.
class Sample {
 public:
  virtual ~Sample() = default;
  virtual void greet(std::optional<std::string> name, CompletionHandler<std::string> completion) = 0;
  virtual void list(CompletionHandler<SXError, Dictionary> completion) = 0;
};

inline const ProtocolTable<Sample> &sampleProtocol() {
  static const ProtocolTable<Sample> table =
      ProtocolTable<Sample>("Sample", "org.sample.Sample", "/org/sample/Sample")
          .row("greetName:completion:", "Greet", &Sample::greet, {"name", "greeting"})
          .row("listCompletion:", "List", &Sample::list, {"error", "items"});
  return table;
}

}  // namespace storix::fake
