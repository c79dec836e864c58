#include "tests/contract/ContractTest.h"

#include <thread>

namespace storix::contract {

BundleDescription describedBundle(const std::string &identifier) {
  const std::string group = "group." + identifier;
  BundleDescription bundle;
  bundle.name = identifier;
  bundle.identifier = identifier;
  bundle.groups = {group};
  bundle.info.emplace("KTExtension", Dictionary{{"KTExtensionStorixDocumentGroup", group}});
  return bundle;
}

std::vector<HostKind> hostsUnderTest() { return {{"Fake", makeFakeHost}, {"Linux", makeLinuxHost}}; }

void ContractTest::runEventLoopDuring(const std::function<void()> &steps) {
  std::thread others([this, &steps] {
    steps();
    host().endEventLoop();
  });
  platform().runEventLoop();
  others.join();
}

}  // namespace storix::contract
