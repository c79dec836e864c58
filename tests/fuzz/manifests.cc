// Application manifests: which program is which application, and what it may do.

#include <sys/stat.h>

#include "platform/linux/identity/ApplicationManifests.h"
#include "tests/fuzz/FuzzDirectory.h"
#include "tests/fuzz/Target.h"

using storix::fuzz::require;
using storix::linuxhost::ApplicationManifests;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  static const storix::fuzz::FuzzDirectory directory;
  directory.write("org.sample.application.kvs", storix::fuzz::textOf(bytes, size));
  ApplicationManifests manifests({directory.path()});
  const auto byName = manifests.manifestForIdentifier("org.sample.application");
  require(!byName || byName->bundleIdentifier == "org.sample.application", "the manifest names another application");
  struct stat shell {};
  if (::stat("/bin/sh", &shell) == 0) {
    const auto byProgram = manifests.manifestForExecutable(shell.st_dev, shell.st_ino);
    require(!byProgram || byName == byProgram, "the same manifest says two things");
  }
  return 0;
}
