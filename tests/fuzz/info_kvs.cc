// Info.kvs, and all that is taken from it before the bundle's program runs.

#include "platform/linux/extensions/ExtensionBundles.h"
#include "tests/fuzz/FuzzDirectory.h"
#include "tests/fuzz/Target.h"

using storix::fuzz::require;
using namespace storix::linuxhost;

namespace {

void checkWishes(const ConfinementWishes &wishes) {
  for (const auto *paths : {&wishes.readOnly, &wishes.readWrite}) {
    for (const std::string &path : *paths) {
      require(path.starts_with('/') || path.starts_with("~/"), "a wished path is not absolute");
      require((path + "/").find("/../") == std::string::npos, "a wished path leads upwards");
      require(path.find('\0') == std::string::npos, "a wished path holds a zero byte");
    }
  }
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  static const storix::fuzz::FuzzDirectory directory;
  directory.write(std::string(infoFileName), storix::fuzz::textOf(bytes, size));
  const auto read = readExtensionBundle(directory.path());
  if (!read) {
    require(!read.error().message().empty(), "a refusal says nothing");
    return 0;
  }
  const ExtensionBundle &bundle = *read.value();
  require(!bundle.identifier || !bundle.identifier->empty(), "an empty identifier counts");
  if (const auto executable = bundle.executablePath()) {
    const std::string &path = executable.value();
    require(path.starts_with(directory.path() + "/"), "the program lies outside of the bundle");
    require((path + "/").find("/../") == std::string::npos && path.find('\0') == std::string::npos,
            "the program's path leads upwards, or is none");
  }
  const ExtensionPlaces places{{directory.path()}, "/groups"};
  for (const std::string &group : bundle.groups) {
    const std::string path = groupContainerPath(places, group);
    require(path == "/groups/" + group && group != "." && group != ".." && group.find('/') == std::string::npos,
            "a group's container lies elsewhere");
  }
  checkWishes(bundle.wishes);
  std::optional<std::string> container;
  if (const auto group = bundle.documentGroup()) container = groupContainerPath(places, *group);
  for (const std::string &variable : extensionProcessEnvironment({}, bundle, container)) {
    require(variable.find('=') != std::string::npos, "a variable has no value");
    require(variable.find('\0') == std::string::npos, "a variable holds a zero byte");
  }
  return 0;
}
