#pragma once

#include <filesystem>
#include <string>
#include <string_view>

namespace storix::fuzz {

/// A directory for the files of a target whose parser opens them itself. Removed when the process ends in
/// order.
class FuzzDirectory {
 public:
  FuzzDirectory();
  ~FuzzDirectory();
  FuzzDirectory(const FuzzDirectory &) = delete;
  FuzzDirectory &operator=(const FuzzDirectory &) = delete;

  [[nodiscard]] std::string path() const { return path_.string(); }
  void write(const std::string &name, std::string_view content) const;

 private:
  std::filesystem::path path_;
};

}  // namespace storix::fuzz
