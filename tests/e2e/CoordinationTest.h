#pragma once

#include <filesystem>
#include <functional>
#include <memory>
#include <string>

#include "storix/FileCoordinator.h"
#include "tests/e2e/BareClient.h"
#include "tests/e2e/E2ETest.h"

namespace storix::e2e {

/// A session whose clients claim files.
class CoordinationTest : public E2ETest {
 protected:
  static constexpr const char *provider = "org.sample.docs";

  /// A confined provider sees neither the platform socket nor what lies outside of its container.
  CoordinationTest() { session.environment["STORIX_CONFINEMENT"] = "off"; }

  /// Starts the daemon, and waits until the installed providers are registered.
  void serve() {
    start();
    const Client::Outcome outcome = makeClient()->wakeUp();
    ASSERT_FALSE(outcome) << outcome->message();
  }

  [[nodiscard]] ClientOptions options() const {
    ClientOptions options;
    options.runtimeDirectory = session.runtimeDirectory().string();
    options.timeout = deadline;
    return options;
  }

  [[nodiscard]] std::unique_ptr<FileCoordinator> makeCoordinator() const {
    return std::make_unique<FileCoordinator>(options());
  }

  [[nodiscard]] std::unique_ptr<BareClient> makeBareClient() const {
    return std::make_unique<BareClient>(session.platformSocket().string(), BareClient::fileCoordination);
  }

  /// A file of no provider, which need not be there.
  [[nodiscard]] URL plainFile(const std::string &name) const {
    return *URL::fileURLWithPath((session.directory() / "plain" / name).string());
  }

  /// A process that has claimed the file.
  [[nodiscard]] std::unique_ptr<Process> holder(const std::string &kind, const URL &url) const {
    auto process = std::make_unique<Process>(
        std::vector<std::string>{builtProgram("e2e_claim_holder").string(), kind, url.absoluteString()},
        session.environment);
    EXPECT_TRUE(process->waitForLine("held"));
    return process;
  }

  static void kill(Process &process) {
    process.signal(SIGKILL);
    EXPECT_EQ(128 + SIGKILL, process.wait());
  }

  /// The claim was got; it ends.
  static void expectHeld(Result<FileClaim> claim) {
    ASSERT_TRUE(claim) << claim.error().message();
    const auto error = claim.value().end();
    EXPECT_FALSE(error) << error->message();
  }

  static void expectTimedOut(const Result<FileClaim> &claim) {
    ASSERT_FALSE(claim);
    EXPECT_TRUE(isClientError(claim.error(), ClientErrorCode::timedOut)) << claim.error().message();
  }
};

/// Long enough for a claim that nobody is in the way of, on a busy machine.
inline constexpr std::chrono::seconds patience{60};
/// For a claim that must not come.
inline constexpr std::chrono::milliseconds impatience{300};

}  // namespace storix::e2e
