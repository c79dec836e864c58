#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <array>
#include <fstream>
#include <iterator>
#include <string>

#include "access/SXAccessControlStore.h"
#include "daemon/SXServer.h"
#include "platform/ProcessScope.h"
#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/TestDirectory.h"
#include "providers/_KTStorixVendor.h"
#include "wire/Introspection.h"
#include "wire/SdBus.h"

namespace storix {
namespace {

/// The shipped description of the interfaces of one socket.
std::string shippedFile(const std::string &name) {
  std::ifstream file(std::string(STORIX_SOURCE_DIR) + "/packaging/dbus/" + name + ".xml", std::ios::binary);
  EXPECT_TRUE(file.is_open()) << name;
  return std::string(std::istreambuf_iterator<char>(file), {});
}

std::string answerOf(const std::string &socket, const char *object) {
  sd_bus *bus = nullptr;
  EXPECT_GE(sd_bus_new(&bus), 0);
  const wire::OwnedBus owned(bus);
  EXPECT_GE(sd_bus_set_address(bus, ("unix:path=" + socket).c_str()), 0);
  EXPECT_GE(sd_bus_start(bus), 0);
  sd_bus_message *reply = nullptr;
  EXPECT_GE(sd_bus_call_method(bus, nullptr, object, "org.freedesktop.DBus.Introspectable", "Introspect", nullptr,
                               &reply, ""),
            0);
  const wire::OwnedMessage ownedReply(reply);
  const char *xml = nullptr;
  if (!reply || sd_bus_message_read(reply, "s", &xml) < 0) return {};
  return xml;
}

TEST(ShippedIntrospection, IsWhatTheSocketsAnswer) {
  const linuxhost::TestDirectory directory;
  const auto environment = linuxhost::HostEnvironment::fromVariables(
      {{"HOME", directory / "home"}, {"STORIX_RUNTIME_DIR", directory / "run"}, {"STORIX_LOG", "fault"}});
  ASSERT_TRUE(environment.ok());
  const auto platform = linuxhost::LinuxPlatform::create(environment.value());
  ASSERT_TRUE(platform.ok()) << platform.error().message();
  {
    const ProcessScope scope(*platform.value());
    const auto server = std::make_shared<SXServer>();
    server->setAccessControlStore(SXAccessControlStore::sharedStore());
    server->startCompletion({});
    EXPECT_EQ(shippedFile("com.tessel.Storix"), answerOf(directory / "run/com.tessel.Storix", "/com/tessel/Storix"));
    EXPECT_EQ(shippedFile("com.tessel.Platform"),
              answerOf(directory / "run/com.tessel.Platform", "/com/tessel/Platform"));
    platform.value()->shutDown();
  }
}

TEST(ShippedIntrospection, DescribesWhatExtensionsExport) {
  const std::array<const wire::InterfaceDescription *, 1> interfaces{
      &wire::interfaceOf(_KTStorixVendorProtocol().description())};
  EXPECT_EQ(shippedFile("com.tessel.StorixVendor"), wire::introspectionXML(interfaces, {}));
}

}  // namespace
}  // namespace storix
