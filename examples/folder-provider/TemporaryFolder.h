#pragma once

#include <fcntl.h>
#include <sys/stat.h>

#include <array>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

namespace storix::example {

/// A fresh directory for one test, removed with all its content at the end.
class TemporaryFolder {
 public:
  TemporaryFolder() {
    std::string name = (std::filesystem::temp_directory_path() / "storix-example-XXXXXX").string();
    if (::mkdtemp(name.data())) root_ = name;
  }
  ~TemporaryFolder() {
    std::error_code ignored;
    if (!root_.empty()) std::filesystem::remove_all(root_, ignored);
  }
  TemporaryFolder(const TemporaryFolder &) = delete;
  TemporaryFolder &operator=(const TemporaryFolder &) = delete;

  [[nodiscard]] const std::string &root() const { return root_; }
  [[nodiscard]] std::string path(const std::string &relative) const { return root_ + "/" + relative; }

  void write(const std::string &relative, const std::string &content) const {
    std::ofstream(path(relative), std::ios::binary) << content;
  }
  [[nodiscard]] std::string read(const std::string &relative) const {
    std::ifstream stream(path(relative), std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), {}};
  }
  void setModificationTime(const std::string &relative, time_t seconds, long nanoseconds = 0) const {
    const std::array<timespec, 2> times{timespec{0, UTIME_OMIT}, timespec{seconds, nanoseconds}};
    ::utimensat(AT_FDCWD, path(relative).c_str(), times.data(), 0);
  }

 private:
  std::string root_;
};

}  // namespace storix::example
