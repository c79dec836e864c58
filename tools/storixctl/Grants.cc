#include "tools/storixctl/Grants.h"

#include <cerrno>
#include <utility>

#include "access/AccessControlMap.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "tools/storixctl/Advice.h"
#include "tools/storixctl/Table.h"

namespace storix::ctl {

namespace {

SXError unreadable(const SXError &error, const std::string &path) {
  if (error.domain() == posixErrorDomain && error.code() == ENOENT) {
    return withAdvice(posixError(ENOENT, path),
                      "Nothing has been granted yet, or HOME is not that of the user whose daemon it is.");
  }
  if (error.domain() != filesErrorDomain) return error;
  return withAdvice(
      error,
      "A daemon that starts with this file knows no grant, and puts a new one in its place with the next: "
      "put it right, or away, before that.");
}

Result<AccessControlMap> readMap(const std::string &path) {
  auto content = linuxhost::readKeyedValueFile(path);
  if (!content) return unreadable(content.error(), path);
  auto map = AccessControlMap::fromValue(Value(std::move(content.value())));
  if (!map) return unreadable(withAdvice(map.error(), "It is " + path + "."), path);
  return map;
}

bool wanted(const std::string *only, const std::string &identifier) { return !only || *only == identifier; }

}  // namespace

Result<Printed> grants(const Invocation &invocation, const std::string &homeDirectory, bool forTerminal) {
  if (!homeDirectory.starts_with('/')) {
    return posixError(EINVAL, "looking for the access-control file: set HOME to your home directory");
  }
  const std::string path =
      homeDirectory + "/" + std::string(accessControlDirectory) + "/" + std::string(accessControlFileName);
  const auto map = readMap(path);
  if (!map) return map.error();

  List list;
  Table table({"PROVIDER", "APPLICATION", "ITEM"});
  // The map has been checked: every level is what it should be.
  for (const auto &[provider, consumers] : map.value().dictionary()) {
    if (!wanted(invocation.value(Option::provider), provider)) continue;
    for (const auto &[consumer, fields] : *consumers.dictionary()) {
      if (!wanted(invocation.value(Option::consumer), consumer)) continue;
      const auto allowed = fields.dictionary()->find(AccessControlMap::allowedItemIDsKey);
      if (allowed == fields.dictionary()->end()) continue;
      for (const Value &item : *allowed->second.list()) {
        table.add({provider, consumer, *item.string()});
        list.emplace_back(Dictionary{{"provider", provider}, {"consumer", consumer}, {"item", item}});
      }
    }
  }
  return Printed{{{"grants", std::move(list)}}, table.text(forTerminal)};
}

}  // namespace storix::ctl
