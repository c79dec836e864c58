// Runs a fuzz target over files, or over the files of directories: how the ordinary tests replay a corpus.

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/fuzz/Target.h"

namespace {

namespace fs = std::filesystem;

std::vector<fs::path> filesAt(const fs::path &path) {
  if (!fs::is_directory(path)) return {path};
  std::vector<fs::path> files;
  for (const fs::directory_entry &entry : fs::directory_iterator(path)) files.push_back(entry.path());
  std::sort(files.begin(), files.end());
  return files;
}

bool replay(const fs::path &file) {
  std::ifstream stream(file, std::ios::binary);
  const std::string content{std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>()};
  if (stream.bad() || !stream.is_open()) return false;
  // The last words, should this input end the process.
  std::fprintf(stderr, "%s\n", file.c_str());
  LLVMFuzzerTestOneInput(reinterpret_cast<const std::uint8_t *>(content.data()), content.size());
  return true;
}

}  // namespace

int main(int count, char **arguments) {
  std::size_t replayed = 0;
  for (int i = 1; i < count; ++i) {
    for (const fs::path &file : filesAt(arguments[i])) {
      if (!replay(file)) {
        std::fprintf(stderr, "%s cannot be read\n", file.c_str());
        return 1;
      }
      ++replayed;
    }
  }
  if (replayed == 0) {
    std::fprintf(stderr, "nothing to replay\n");
    return 1;
  }
  std::printf("%zu inputs\n", replayed);
  return 0;
}
