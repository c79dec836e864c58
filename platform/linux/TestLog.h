#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"

namespace storix::linuxhost {

/// Keeps what is logged while it lives.
class TestLog {
 public:
  /// The lines since the last call.
  std::vector<std::string> take() {
    std::vector<std::string> texts;
    for (fake::LogLine &line : platform_->log().take()) texts.push_back(std::move(line.text));
    return texts;
  }

 private:
  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
  ProcessScope scope_{*platform_};
};

}  // namespace storix::linuxhost
