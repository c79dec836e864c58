#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "access/SXAccessControlStore.h"
#include "daemon/SXServer.h"
#include "platform/ProcessScope.h"
#include "platform/linux/HostEnvironment.h"
#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/RuntimeDirectory.h"
#include "providers/_KTStorixExtensionHostContext.h"

namespace {

using storix::linuxhost::HostEnvironment;
using storix::linuxhost::LinuxPlatform;

constexpr int cannotStartStatus = 1;
constexpr int usageErrorStatus = 2;

constexpr std::string_view help =
    "Usage: storixd [--help | --version]\n"
    "\n"
    "The document broker of a user's session. Runs until it is told to end by SIGTERM or SIGINT.\n"
    "\n"
    "Environment:\n"
    "  STORIX_RUNTIME_DIR        directory of the sockets (default: $XDG_RUNTIME_DIR/storix)\n"
    "  STORIX_EXTENSIONS_PATH    where providers are installed (default: storix/extensions below\n"
    "                            $XDG_DATA_HOME and each of $XDG_DATA_DIRS)\n"
    "  STORIX_APPLICATIONS_PATH  where application manifests are (default: storix/applications below\n"
    "                            the same)\n"
    "  STORIX_LOG                fault, default, info or debug\n";

void print(std::FILE *stream, std::string_view text) { (void)std::fwrite(text.data(), 1, text.size(), stream); }

/// The status to end with, when the arguments ask for something else than to run.
std::optional<int> statusForArguments(int count, char **arguments) {
  if (count <= 1) return std::nullopt;
  const std::string_view option = arguments[1];
  if (count == 2 && option == "--help") {
    print(stdout, help);
    return 0;
  }
  if (count == 2 && option == "--version") {
    print(stdout, "storixd " STORIX_VERSION "\n");
    return 0;
  }
  const std::string_view wrong = option == "--help" || option == "--version" ? arguments[2] : arguments[1];
  print(stderr,
        "storixd: unexpected argument \"" + std::string(wrong) + "\"; storixd takes --help or --version alone.\n");
  return usageErrorStatus;
}

storix::Result<std::unique_ptr<LinuxPlatform>> makePlatform(std::vector<std::string> &warnings) {
  storix::Result<HostEnvironment> environment = HostEnvironment::fromVariables(storix::linuxhost::processEnvironment());
  if (!environment) return environment.error();
  warnings = environment.value().warnings;
  storix::Result<storix::linuxhost::ActivatedSockets> sockets = storix::linuxhost::takeActivatedSockets();
  if (!sockets) return sockets.error();
  std::optional<std::string> missing = storix::linuxhost::missingSocketWarning(sockets.value());
  if (missing) warnings.push_back(*std::move(missing));
  return LinuxPlatform::create(std::move(environment.value()), std::move(sockets.value()));
}

}  // namespace

int main(int count, char **arguments) {
  if (const std::optional<int> status = statusForArguments(count, arguments)) return *status;

  std::vector<std::string> warnings;
  storix::Result<std::unique_ptr<LinuxPlatform>> platform = makePlatform(warnings);
  if (!platform) {
    print(stderr, "storixd: " + platform.error().message() + "\n");
    return cannotStartStatus;
  }
  storix::ProcessScope scope(*platform.value());
  using HostContext = storix::_KTStorixExtensionHostContext;
  platform.value()->registerExtensionContextClass(HostContext::name, HostContext::contextClass());

  (void)storix::sx_default_log();
  const char *const name = count > 0 ? arguments[0] : "storixd";
  storix::sx_default_log().notice("[NOTICE] %s starting.", name);
  storix::sx_default_log().debug("[DEBUG] Debug logging enabled.");
  for (const std::string &warning : warnings) storix::sx_default_log().notice("[NOTICE] %@", warning);

  auto server = std::make_shared<storix::SXServer>();
  server->setAccessControlStore(storix::SXAccessControlStore::sharedStore());
  server->startCompletion({});
  platform.value()->runEventLoop();
  server.reset();
  return 0;
}
