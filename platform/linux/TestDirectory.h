#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

namespace storix::linuxhost {

/// A directory of a test's own, resolved, with what is in it gone at the end.
class TestDirectory {
 public:
  TestDirectory() {
    const char *place = std::getenv("TMPDIR");
    std::string name = std::string(place && *place ? place : "/tmp") + "/storix-test-XXXXXX";
    if (!::mkdtemp(name.data())) ADD_FAILURE() << "no directory for the test at " << name;
    path_ = std::filesystem::canonical(name).string();
  }
  ~TestDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TestDirectory(const TestDirectory &) = delete;
  TestDirectory &operator=(const TestDirectory &) = delete;

  [[nodiscard]] const std::string &path() const { return path_; }
  [[nodiscard]] std::string operator/(const std::string &name) const { return path_ + "/" + name; }

  /// Each gives the path of what it made; the directories above are made too.
  std::string makeDirectory(const std::string &name) const {
    std::filesystem::create_directories(*this / name);
    return *this / name;
  }
  std::string makeFile(const std::string &name, const std::string &content) const {
    std::filesystem::create_directories(std::filesystem::path(*this / name).parent_path());
    std::ofstream(*this / name, std::ios::binary) << content;
    return *this / name;
  }
  std::string makeLink(const std::string &name, const std::string &target) const {
    std::filesystem::create_symlink(target, *this / name);
    return *this / name;
  }
  [[nodiscard]] std::string contentOf(const std::string &name) const {
    std::ifstream file(*this / name, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(file), {});
  }
  /// The names in the directory, hidden ones too, in order.
  [[nodiscard]] std::vector<std::string> names() const {
    std::vector<std::string> names;
    for (const auto &entry : std::filesystem::directory_iterator(path_)) names.push_back(entry.path().filename());
    std::sort(names.begin(), names.end());
    return names;
  }

 private:
  std::string path_;
};

}  // namespace storix::linuxhost
