#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using StartProvidingTest = ItemRequestsTest;

TEST_F(StartProvidingTest, StartNamesTheIdentifierThatDoesNotFitTheOwner) {
  expectEarlyFailure(start, arguments(item_, "org.b", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", "org.b"));
  expectEarlyFailure(start, arguments(item_, "ORG.A", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", "ORG.A"));
}

TEST_F(StartProvidingTest, AProvidersDirectoryItselfHasNoOwner) {
  const std::optional<URL> directory = storageURL("org.a");
  const std::vector<std::string> lookup{
      compared("org.a", *directory),
      "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"};
  expectEarlyFailure(start, arguments(directory, "org.a", "org.app"), lookup, SXNotFoundError("org.a"));
}

}  // namespace
}  // namespace storix
