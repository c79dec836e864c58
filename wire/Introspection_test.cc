#include "wire/Introspection.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "providers/_KTStorixVendor.h"
#include "service/SXDaemon.h"
#include "wire/PlatformInterfaces.h"

namespace storix::wire {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

std::vector<std::string> signaturesOf(const InterfaceDescription &interface) {
  std::vector<std::string> lines;
  for (const MethodDescription &method : interface.methods) {
    lines.push_back(std::string(method.name) + " " + method.inSignature + " > " + method.outSignature);
  }
  return lines;
}

TEST(Signatures, DaemonHasTheNineMethodsOfTheWirePage) {
  const InterfaceDescription &interface = interfaceOf(SXDaemonProtocol().description());
  EXPECT_EQ(interface.name, "com.tessel.Storix.Daemon");
  EXPECT_EQ(interface.objectPath, "/com/tessel/Storix");
  EXPECT_THAT(
      signaturesOf(interface),
      ElementsAre("WakeUp  > ", "ExtendSandboxForFileURL asasas > a(sxa{sv})aayasaay",
                  "ProvidePlaceholderForItemAtURL asasas > a(sxa{sv})", "StartProvidingItemAtURL asasas > a(sxa{sv})",
                  "StopProvidingItemAtURL asasas > a(sxa{sv})", "Providers  > a(sxa{sv})aa{sv}",
                  "ExtendBookmarkForFileURL asas > asa(sxa{sv})", "BookmarkableStringFromDocumentURL as > asa(sxa{sv})",
                  "DocumentURLFromBookmarkableString as > asaayasaaya(sxa{sv})"));
}

TEST(Signatures, VendorHasTheSevenMethodsOfTheWirePage) {
  const InterfaceDescription &interface = interfaceOf(_KTStorixVendorProtocol().description());
  EXPECT_EQ(interface.name, "com.tessel.StorixVendor");
  EXPECT_EQ(interface.objectPath, "/com/tessel/StorixVendor");
  EXPECT_THAT(signaturesOf(interface),
              ElementsAre("PerformInitialSetup  > asasa(sxa{sv})", "ProvidePlaceholderAtURL as > asa(sxa{sv})",
                          "StartProvidingItemAtURL as > a(sxa{sv})", "ItemChangedAtURL as > a(sxa{sv})",
                          "StopProvidingItemAtURL as > a(sxa{sv})", "IdentifierForItemAtURL as > a(sxa{sv})as",
                          "URLForItemIdentifier as > a(sxa{sv})as"));
}

TEST(Signatures, PlatformInterfacesAreThoseOfTheWirePage) {
  EXPECT_THAT(signaturesOf(fileCoordinationInterface()), ElementsAre("BeginRead sas > a(sxa{sv})at", "EndRead t > ",
                                                                     "BeginWrite sas > a(sxa{sv})at", "EndWrite t > "));
  EXPECT_THAT(signaturesOf(sandboxInterface()), ElementsAre("Consume ay > h", "ProveWriteAccess h > "));
  EXPECT_THAT(signaturesOf(notificationsInterface()), ElementsAre("Post s > "));
}

TEST(Signatures, OneDescriptionIsKeptPerProtocol) {
  EXPECT_EQ(&interfaceOf(SXDaemonProtocol().description()), &interfaceOf(SXDaemonProtocol().description()));
}

TEST(Introspection, NamesEveryMethodWithItsArgumentsInOrder) {
  const InterfaceDescription *interface = &sandboxInterface();
  const std::string xml = introspectionXML({&interface, 1}, {});
  EXPECT_THAT(xml, HasSubstr(" <interface name=\"com.tessel.Platform.Sandbox\">\n"
                             "  <method name=\"Consume\">\n"
                             "   <arg type=\"ay\" name=\"tokenData\" direction=\"in\"/>\n"
                             "   <arg type=\"h\" name=\"fileDescriptor\" direction=\"out\"/>\n"
                             "  </method>\n"));
  EXPECT_THAT(xml, HasSubstr("<interface name=\"org.freedesktop.DBus.Introspectable\">"));
  EXPECT_THAT(xml, HasSubstr("<interface name=\"org.freedesktop.DBus.Peer\">"));
}

TEST(Introspection, ChildrenAreTheNextComponentsOnce) {
  const std::vector<std::string_view> paths{"/com/tessel/Storix", "/com/tessel/Platform", "/org/x"};
  EXPECT_THAT(childrenOf("/", paths), ElementsAre("com", "org"));
  EXPECT_THAT(childrenOf("/com/tessel", paths), ElementsAre("Storix", "Platform"));
  EXPECT_THAT(childrenOf("/com/tessel/Storix", paths), IsEmpty());
  EXPECT_THAT(childrenOf("/co", paths), IsEmpty());
}

}  // namespace
}  // namespace storix::wire
