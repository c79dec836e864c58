// Clients that are not ours: gdbus and busctl.

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

class Tools : public E2ETest {
 protected:
  Tools() {
    session.installProvider("org.sample.docs");
    // Both tools may hand out access.
    for (const char *tool : {"gdbus", "busctl"}) {
      session.write(session.applicationsDirectory() / (std::string("org.sample.") + tool + ".kvs"),
                    R"({"Executable": "/usr/bin/)" + std::string(tool) +
                        R"(", "Entitlements": {"com.tessel.storix.acl-write": true}})");
    }
  }

  [[nodiscard]] Finished gdbus(const std::string &method, std::vector<std::string> arguments = {}) const {
    std::vector<std::string> command{"gdbus",         "call",
                                     "--address",     "unix:path=" + session.serviceSocket().string(),
                                     "--dest",        "com.tessel.Storix",
                                     "--object-path", "/com/tessel/Storix",
                                     "--method",      "com.tessel.Storix.Daemon." + method};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return run(std::move(command), session.environment);
  }

  [[nodiscard]] Finished busctl(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), {"busctl", "--address=unix:path=" + session.serviceSocket().string()});
    return run(std::move(arguments), session.environment);
  }
};

TEST_F(Tools, GdbusWakesUpAndLists) {
  start();
  const Finished woken = gdbus("WakeUp");
  EXPECT_EQ(0, woken.status) << woken.errors;
  EXPECT_EQ("()\n", woken.output);
  const Finished listed = gdbus("Providers");
  EXPECT_EQ(0, listed.status) << listed.errors;
  EXPECT_NE(std::string::npos, listed.output.find("'providerIdentifier': <'org.sample.docs'>")) << listed.output;
  EXPECT_NE(std::string::npos, listed.output.find("'documentStorageURL': <('file://")) << listed.output;
}

TEST_F(Tools, BusctlWakesUpAndLists) {
  start();
  const Finished woken =
      busctl({"call", "com.tessel.Storix", "/com/tessel/Storix", "com.tessel.Storix.Daemon", "WakeUp"});
  EXPECT_EQ(0, woken.status) << woken.errors;
  const Finished listed =
      busctl({"call", "com.tessel.Storix", "/com/tessel/Storix", "com.tessel.Storix.Daemon", "Providers"});
  EXPECT_EQ(0, listed.status) << listed.errors;
  EXPECT_NE(std::string::npos, listed.output.find("org.sample.docs")) << listed.output;
}

TEST_F(Tools, BothIntrospectBothSockets) {
  start();
  const std::vector<std::pair<std::string, std::string>> objects{{"com.tessel.Storix", "/com/tessel/Storix"},
                                                                 {"com.tessel.Platform", "/com/tessel/Platform"}};
  for (const auto &[name, path] : objects) {
    const std::string address = "unix:path=" + (session.runtimeDirectory() / name).string();
    const std::string method = name == "com.tessel.Storix" ? "DocumentURLFromBookmarkableString" : "ProveWriteAccess";
    const Finished byBusctl = run({"busctl", "--address=" + address, "introspect", name, path}, session.environment);
    EXPECT_EQ(0, byBusctl.status) << byBusctl.errors;
    EXPECT_NE(std::string::npos, byBusctl.output.find(method)) << byBusctl.output;
    const Finished byGdbus =
        run({"gdbus", "introspect", "--address", address, "--dest", name, "--object-path", path}, session.environment);
    EXPECT_EQ(0, byGdbus.status) << byGdbus.errors;
    EXPECT_NE(std::string::npos, byGdbus.output.find(method)) << byGdbus.output;
  }
}

TEST_F(Tools, GdbusCarriesADocumentAllTheWay) {
  start();
  const std::string url = itemURL("org.sample.docs", "report").absoluteString();
  const std::vector<std::string> arguments{"['" + url + "']", "['org.sample.docs']", "['org.sample.gdbus']"};
  const Finished granted = gdbus("ExtendSandboxForFileURL", arguments);
  EXPECT_EQ(0, granted.status) << granted.errors;
  EXPECT_EQ(0U, granted.output.find("(@a(sxa{sv}) [], [[byte")) << granted.output;
  for (const char *method : {"ProvidePlaceholderForItemAtURL", "StartProvidingItemAtURL"}) {
    const Finished done = gdbus(method, arguments);
    EXPECT_EQ("(@a(sxa{sv}) [],)\n", done.output) << method << done.errors;
  }
  const Finished bookmark = gdbus("BookmarkableStringFromDocumentURL", {arguments[0]});
  EXPECT_EQ("(['storix:org.sample.docs/report'], @a(sxa{sv}) [])\n", bookmark.output) << bookmark.errors;
  const Finished shared = gdbus("ExtendBookmarkForFileURL", {arguments[0], "['org.sample.gdbus']"});
  EXPECT_EQ(bookmark.output, shared.output) << shared.errors;
  const Finished resolved = gdbus("DocumentURLFromBookmarkableString", {"['storix:org.sample.docs/report']"});
  EXPECT_EQ(0U, resolved.output.find("(['" + url + "'], [[byte")) << resolved.output << resolved.errors;
  const Finished stopped = gdbus("StopProvidingItemAtURL", arguments);
  EXPECT_EQ(0U, stopped.output.find("([('com.tessel.storix', int64 6,")) << stopped.output << stopped.errors;
}

TEST_F(Tools, BusctlCarriesADocumentAllTheWay) {
  start();
  const std::string url = itemURL("org.sample.docs", "report").absoluteString();
  const auto call = [this](const std::string &method, std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(),
                     {"call", "com.tessel.Storix", "/com/tessel/Storix", "com.tessel.Storix.Daemon", method});
    return busctl(std::move(arguments));
  };
  const std::vector<std::string> item{"asasas", "1", url, "1", "org.sample.docs", "1", "org.sample.busctl"};
  const Finished granted = call("ExtendSandboxForFileURL", item);
  EXPECT_EQ(0U, granted.output.find("a(sxa{sv})aayasaay 0 1 ")) << granted.output << granted.errors;
  EXPECT_EQ("a(sxa{sv}) 0\n", call("ProvidePlaceholderForItemAtURL", item).output);
  EXPECT_EQ("a(sxa{sv}) 0\n", call("StartProvidingItemAtURL", item).output);
  const std::string bookmark = "asa(sxa{sv}) 1 \"storix:org.sample.docs/report\" 0\n";
  EXPECT_EQ(bookmark, call("BookmarkableStringFromDocumentURL", {"as", "1", url}).output);
  EXPECT_EQ(bookmark, call("ExtendBookmarkForFileURL", {"asas", "1", url, "1", "org.sample.busctl"}).output);
  const Finished resolved = call("DocumentURLFromBookmarkableString", {"as", "1", "storix:org.sample.docs/report"});
  EXPECT_EQ(0U, resolved.output.find("asaayasaaya(sxa{sv}) 1 \"" + url)) << resolved.output << resolved.errors;
  EXPECT_EQ(0U, call("StopProvidingItemAtURL", item).output.find("a(sxa{sv}) 1 \"com.tessel.storix\" 6"));
}

}  // namespace
}  // namespace storix::e2e
