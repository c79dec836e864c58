#include "platform/linux/identity/UnitNames.h"

#include <gtest/gtest.h>

namespace storix::linuxhost {
namespace {

std::string unit(std::string_view name) { return applicationIdentifierFromUnit(name).value_or("none"); }
std::string cgroup(std::string_view text) { return applicationIdentifierFromCgroup(text).value_or("none"); }

TEST(UnitNames, ScopeNamesTheApplicationBeforeItsRandomPart) {
  EXPECT_EQ(unit("app-org.sample.Editor-1234.scope"), "org.sample.Editor");
  EXPECT_EQ(unit("app-gnome-org.sample.Editor-1234.scope"), "org.sample.Editor");
  EXPECT_EQ(unit("app-flatpak-org.sample.Editor-12-34.scope"), "none");
  EXPECT_EQ(unit("app-org.sample.Editor.scope"), "none");
  EXPECT_EQ(unit("app-org.sample.Editor-.scope"), "none");
}

TEST(UnitNames, ServiceNamesTheApplicationBeforeItsInstance) {
  EXPECT_EQ(unit("app-org.sample.Editor.service"), "org.sample.Editor");
  EXPECT_EQ(unit("app-org.sample.Editor@autostart.service"), "org.sample.Editor");
  EXPECT_EQ(unit("app-gnome-org.sample.Editor@12-34@5.service"), "org.sample.Editor");
  EXPECT_EQ(unit("app-gnome-org.sample.Editor.service"), "org.sample.Editor");
  EXPECT_EQ(unit("app-a-b-org.sample.Editor.service"), "none");
  EXPECT_EQ(unit("app-org.sample.Editor@.service"), "none");
}

TEST(UnitNames, EscapedDashIsADash) {
  EXPECT_EQ(unit("app-sample\\x2deditor-1.scope"), "sample-editor");
  EXPECT_EQ(unit("app-my\\x2dlauncher-sample\\x2d\\x2deditor.service"), "sample--editor");
  EXPECT_EQ(unit("app-sample\\x2feditor\\x2-1.scope"), "sample\\x2feditor\\x2");
}

TEST(UnitNames, OtherUnitsNameNobody) {
  for (const char *name : {"", "app-", "app-.scope", "app--1.scope", "app--.service", ".scope", "app.slice",
                           "app-x.slice", "session-1.scope", "xapp-a-1.scope", "app-a-1.scope.d", "app-a-1",
                           "app-@x.service", "app-a-1.scope (deleted)", "app-\xFF-1.scope"}) {
    EXPECT_EQ(unit(name), "none") << name;
  }
}

TEST(UnitNames, LastApplicationUnitOfThePathCounts) {
  const std::string user = "/user.slice/user-1000.slice/user@1000.service/app.slice/";
  EXPECT_EQ(cgroup("0::" + user + "app-org.sample.Editor-1.scope\n"), "org.sample.Editor");
  EXPECT_EQ(cgroup("0::" + user + "app-org.sample.Editor-1.scope/worker"), "org.sample.Editor");
  EXPECT_EQ(cgroup("0::" + user + "app-org.sample.A-1.scope/app-org.sample.B.service\n"), "org.sample.B");
  EXPECT_EQ(cgroup("0::" + user + "vte-spawn-1.scope\n"), "none");
  EXPECT_EQ(cgroup("0::/\n"), "none");
}

TEST(UnitNames, OnlySystemdsHierarchyIsLookedAt) {
  EXPECT_EQ(cgroup("4:memory:/app-org.sample.A-1.scope\n1:name=systemd:/app-org.sample.B-1.scope\n0::/\n"),
            "org.sample.B");
  EXPECT_EQ(cgroup("1:name=systemd:/app-org.sample.B-1.scope\n0::/app-org.sample.C-1.scope\n"), "org.sample.C");
  EXPECT_EQ(cgroup("4:memory:/app-org.sample.A-1.scope\n"), "none");
  EXPECT_EQ(cgroup("0::/x\n0:app-org.sample.A-1.scope"), "none");
  EXPECT_EQ(cgroup(""), "none");
  EXPECT_EQ(cgroup("nonsense\n:\n::\n"), "none");
}

}  // namespace
}  // namespace storix::linuxhost
