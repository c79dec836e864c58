// What the document portal and the permission store of a desktop do that the daemon does too: note a
// grant, look it up, list what there is. They are asked on a private bus, and seen from outside alone.

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "bench/Benchmarks.h"
#include "bench/BusClient.h"
#include "bench/Scene.h"
#include "platform/URL.h"
#include "wire/SdBus.h"

namespace storix::bench {

namespace {

namespace fs = std::filesystem;

constexpr const char *storeProgram = "/usr/libexec/xdg-permission-store";
constexpr const char *documentsProgram = "/usr/libexec/xdg-document-portal";
constexpr double grantsFasterBound = 20;
constexpr std::size_t entriesOfBound = 10'000;
const std::string provider = "org.sample.bare";
const std::string application = "org.sample.bench";

/// A bus of its own, with the peers on it.
class PeerBus {
 public:
  explicit PeerBus(const Scene &scene) : socket_(scene.directory() / "bus") {
    const fs::path configuration = scene.directory() / "bus.conf";
    std::ofstream(configuration) << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\""
                                    " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
                                    "<busconfig><type>session</type><listen>unix:path="
                                 << socket_
                                 << "</listen><auth>EXTERNAL</auth><policy context=\"default\">"
                                    "<allow send_destination=\"*\" eavesdrop=\"true\"/><allow eavesdrop=\"true\"/>"
                                    "<allow own=\"*\"/></policy></busconfig>\n";
    std::map<std::string, std::string> environment = scene.environment();
    environment["DBUS_SESSION_BUS_ADDRESS"] = "unix:path=" + socket_;
    environment["XDG_RUNTIME_DIR"] = scene.directory() / "peer";
    environment["GIO_USE_VFS"] = "local";
    fs::create_directory(scene.directory() / "peer");
    fs::permissions(scene.directory() / "peer", fs::perms::owner_all);
    const fs::path log = scene.directory() / "peer.log";
    daemon_ = std::make_unique<Program>(std::vector<std::string>{"/usr/bin/dbus-daemon", "--nofork", "--nopidfile",
                                                                 "--config-file=" + configuration.string()},
                                        environment, log);
    (void)connectTo(socket_);
    store_ = std::make_unique<Program>(std::vector<std::string>{storeProgram}, environment, log);
    if (fs::exists("/dev/fuse")) {
      documents_ = std::make_unique<Program>(std::vector<std::string>{documentsProgram}, environment, log);
    }
    sd_bus *raw = nullptr;
    if (sd_bus_new(&raw) < 0) giveUp("Cannot make a connection.");
    bus_.reset(raw);
    if (sd_bus_set_address(raw, ("unix:path=" + socket_).c_str()) < 0 || sd_bus_set_bus_client(raw, 1) < 0 ||
        sd_bus_start(raw) < 0) {
      giveUp("Cannot connect to the private bus.");
    }
  }

  [[nodiscard]] sd_bus *bus() const { return bus_.get(); }
  [[nodiscard]] bool hasDocuments() const { return documents_ != nullptr; }

  /// Waits until somebody has that name.
  void awaitName(const char *name) const {
    for (int tries = 0; tries < 3000; ++tries) {
      sd_bus_error error{};
      sd_bus_message *reply = nullptr;
      const int found = sd_bus_call_method(bus(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                           "org.freedesktop.DBus", "GetNameOwner", &error, &reply, "s", name);
      sd_bus_message_unref(reply);
      sd_bus_error_free(&error);
      if (found >= 0) return;
      ::usleep(10'000);
    }
    giveUp(std::string("Nobody took the name ") + name);
  }

  /// Calls a peer; what fails ends the benchmark.
  template <class... Values>
  wire::OwnedMessage call(const char *member, const char *types, Values... values) const {
    const bool ofStore = std::strncmp(member, "Documents.", 10) != 0;
    sd_bus_error error{};
    sd_bus_message *reply = nullptr;
    const int result = sd_bus_call_method(
        bus(), ofStore ? "org.freedesktop.impl.portal.PermissionStore" : "org.freedesktop.portal.Documents",
        ofStore ? "/org/freedesktop/impl/portal/PermissionStore" : "/org/freedesktop/portal/documents",
        ofStore ? "org.freedesktop.impl.portal.PermissionStore" : "org.freedesktop.portal.Documents",
        ofStore ? member : member + 10, &error, &reply, types, values...);
    if (result < 0) giveUp(std::string(member) + ": " + (error.message ? error.message : std::strerror(-result)));
    return wire::OwnedMessage(reply);
  }

  void permit(std::size_t number) const {
    const std::string item = "item" + std::to_string(number);
    (void)call("SetPermission", "sbssas", "documents-of-benchmark", 1, item.c_str(), application.c_str(), 1, "read");
  }

  /// As `permit` for each of them, but many at once, for which the store writes once.
  void permitAll(std::size_t from, std::size_t end) const {
    constexpr std::size_t atOnce = 100;
    while (from < end) {
      std::size_t unanswered = 0;
      for (; from < end && unanswered < atOnce; ++from, ++unanswered) {
        const std::string item = "item" + std::to_string(from);
        if (sd_bus_call_method_async(bus(), nullptr, "org.freedesktop.impl.portal.PermissionStore",
                                     "/org/freedesktop/impl/portal/PermissionStore",
                                     "org.freedesktop.impl.portal.PermissionStore", "SetPermission", countAnswer,
                                     &unanswered, "sbssas", "documents-of-benchmark", 1, item.c_str(),
                                     application.c_str(), 1, "read") < 0) {
          giveUp("The permission store cannot be asked.");
        }
      }
      while (unanswered > 0) {
        const int processed = sd_bus_process(bus(), nullptr);
        if (processed < 0) giveUp("The private bus has gone.");
        if (processed == 0) (void)sd_bus_wait(bus(), UINT64_MAX);
      }
    }
  }

 private:
  static int countAnswer(sd_bus_message *reply, void *unanswered, sd_bus_error * /*error*/) {
    if (sd_bus_message_is_method_error(reply, nullptr) > 0) giveUp("The permission store answered an error.");
    --*static_cast<std::size_t *>(unanswered);
    return 0;
  }

  const std::string socket_;
  std::unique_ptr<Program> daemon_;
  std::unique_ptr<Program> store_;
  std::unique_ptr<Program> documents_;
  wire::OwnedBus bus_;
};

/// Our measured beside the peer's: the ratio says how many times as long the peer takes.
void beside(Table &table, std::string what, const Rounds &ours, std::string peerName, const Rounds &peer,
            std::optional<double> atLeast = std::nullopt) {
  Figure figure;
  figure.what = std::move(what);
  figure.measured = median(ours);
  figure.floorName = std::move(peerName);
  figure.floor = median(peer);
  figure.ratio = ratio(peer, ours);
  if (atLeast) {
    figure.bound = "ratio ≥ " + std::to_string(static_cast<int>(*atLeast));
    figure.met = *figure.ratio >= *atLeast;
  }
  table.add(std::move(figure));
}

/// Makes the daemon's file hold that many grants, and asks both for the same.
void measureWith(Table &table, const Scene &scene, const PeerBus &peer, std::size_t count, std::size_t &permitted,
                 std::vector<std::string> &documents) {
  const Extent extent = table.extent();
  const std::string url = URL::fileURLWithPath((scene.storage(provider) / "document").string())->absoluteString();
  if (permitted < count) peer.permitAll(permitted, count);
  permitted = std::max(permitted, count);
  scene.writeGrants(grants(count, false));
  const auto daemon = scene.startDaemon();
  BusClient client(scene.serviceSocket());
  client.call("ExtendSandboxForFileURL", {url, provider, application});
  const std::string bookmark = client.callForText("BookmarkableStringFromDocumentURL", {url});

  const std::string entries = std::to_string(count) + " entries";
  std::size_t made = 0;
  const Contestant grant{"", [&client, &scene, &made](std::size_t times) {
                           for (std::size_t i = 0; i < times; ++i) {
                             const auto path = scene.storage(provider) / ("new" + std::to_string(++made));
                             client.call(
                                 "ExtendSandboxForFileURL",
                                 {URL::fileURLWithPath(path.string())->absoluteString(), provider, application});
                           }
                         }};
  const Contestant permission{"", [&peer, &permitted](std::size_t times) {
                                for (std::size_t i = 0; i < times; ++i) peer.permit(permitted++);
                              }};
  const auto granted = compareTimes(extent, {grant, permission}, 3);
  beside(table, "a new grant, " + entries, granted[0], "permission store", granted[1],
         count == entriesOfBound ? std::optional(grantsFasterBound) : std::nullopt);

  const Contestant resolve{"", [&client, &bookmark](std::size_t times) {
                             for (std::size_t i = 0; i < times; ++i) {
                               client.call("DocumentURLFromBookmarkableString", {bookmark});
                             }
                           }};
  const Contestant lookUp{"", [&peer](std::size_t times) {
                            for (std::size_t i = 0; i < times; ++i) {
                              (void)peer.call("GetPermission", "sss", "documents-of-benchmark", "item7",
                                              application.c_str());
                            }
                          }};
  const auto lookedUp = compare(extent, {resolve, lookUp});
  beside(table, "look up a granted document (asks the extension), " + entries, lookedUp[0], "permission store",
         lookedUp[1]);

  const Contestant listOurs{"", [&client](std::size_t times) {
                              for (std::size_t i = 0; i < times; ++i) client.call("Providers");
                            }};
  const Contestant listTheirs{"", [&peer](std::size_t times) {
                                for (std::size_t i = 0; i < times; ++i)
                                  (void)peer.call("List", "s", "documents-of-benchmark");
                              }};
  const auto listed = compare(extent, {listOurs, listTheirs});
  beside(table, "list (here the providers), " + entries, listed[0], "permission store", listed[1]);

  if (!peer.hasDocuments()) return;
  const auto addDocument = [&peer, &scene, &documents] {
    const fs::path file = scene.directory() / "documents" / std::to_string(documents.size());
    std::ofstream(file) << "x";
    const UniqueFd fd(::open(file.c_str(), O_PATH | O_CLOEXEC));
    const wire::OwnedMessage added = peer.call("Documents.Add", "hbb", fd.get(), 1, 1);
    const char *identifier = nullptr;
    if (sd_bus_message_read(added.get(), "s", &identifier) <= 0) giveUp("The document portal gave no identifier.");
    documents.emplace_back(identifier);
    (void)peer.call("Documents.GrantPermissions", "ssas", identifier, application.c_str(), 1, "read");
  };
  while (documents.size() < count) addDocument();
  const auto exported = compareTimes(extent,
                                     {grant,
                                      {"",
                                       [&addDocument](std::size_t times) {
                                         for (std::size_t i = 0; i < times; ++i) addDocument();
                                       }}},
                                     3);
  beside(table, "a new document and its grant, " + entries, exported[0], "document portal", exported[1],
         count == entriesOfBound ? std::optional(grantsFasterBound) : std::nullopt);
  const auto informed =
      compare(extent, {resolve, {"", [&peer, &documents](std::size_t times) {
                                   for (std::size_t i = 0; i < times; ++i) {
                                     (void)peer.call("Documents.Info", "s", documents.front().c_str());
                                   }
                                 }}});
  beside(table, "look up a document, " + entries, informed[0], "document portal", informed[1]);
  const auto all = compare(extent, {listOurs, {"", [&peer](std::size_t times) {
                                                 for (std::size_t i = 0; i < times; ++i) {
                                                   (void)peer.call("Documents.List", "s", application.c_str());
                                                 }
                                               }}});
  beside(table, "list (here the providers), " + entries, all[0], "document portal", all[1]);
}

}  // namespace

void measurePeers(Table &table) {
  table.section("Peers, on one processor: theirs stands in the place of the floor, and the ratio is theirs to ours");
  if (!fs::exists(storeProgram) || !fs::exists("/usr/bin/dbus-daemon")) {
    std::printf("  Not measured: the packages xdg-desktop-portal and dbus-daemon are not installed.\n");
    return;
  }
  pinToOneProcessor();
  const Scene scene;
  scene.beApplication(application);
  scene.installProvider(provider, "storix_bench_bare");
  fs::create_directory(scene.directory() / "documents");
  const PeerBus peer(scene);
  peer.awaitName("org.freedesktop.impl.portal.PermissionStore");
  if (peer.hasDocuments()) {
    peer.awaitName("org.freedesktop.portal.Documents");
  } else {
    std::printf("  The permission store alone: there is no /dev/fuse here for the document portal.\n");
  }
  std::size_t permitted = 0;
  std::vector<std::string> documents;
  for (const std::size_t count : {10U, 100U, 1000U, 10'000U}) {
    measureWith(table, scene, peer, count, permitted, documents);
  }
}

}  // namespace storix::bench
