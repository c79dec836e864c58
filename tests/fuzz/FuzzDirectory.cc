#include "tests/fuzz/FuzzDirectory.h"

#include <cstdlib>
#include <fstream>
#include <system_error>

#include "tests/fuzz/Target.h"

namespace storix::fuzz {

FuzzDirectory::FuzzDirectory() {
  std::string pattern = (std::filesystem::temp_directory_path() / "storix-fuzz.XXXXXX").string();
  const char *made = ::mkdtemp(pattern.data());
  require(made != nullptr, "no directory can be made for the files of this target");
  path_ = made;
}

FuzzDirectory::~FuzzDirectory() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

void FuzzDirectory::write(const std::string &name, std::string_view content) const {
  std::ofstream stream(path_ / name, std::ios::binary | std::ios::trunc);
  stream << content;
  require(static_cast<bool>(stream.flush()), "the file of this target cannot be written");
}

}  // namespace storix::fuzz
