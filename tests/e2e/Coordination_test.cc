// Processes that read and write the same files, a provider's among them.

#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <set>

#include "tests/e2e/CoordinationTest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

using Coordination = CoordinationTest;

// --- A provider's files

TEST_F(Coordination, ReadHasTheExtensionPutTheContentThere) {
  session.installProvider(provider);
  serve();
  const auto coordinator = makeCoordinator();
  auto claim = coordinator->read(itemURL(provider, "folder/50% é.txt"));
  ASSERT_TRUE(claim) << claim.error().message();
  EXPECT_EQ("contents of folder/50% é.txt", Session::read(session.storage(provider) / "folder/50% é.txt"));
  expectHeld(std::move(claim));
}

TEST_F(Coordination, WriteIsReportedToTheExtensionWhenItEnds) {
  session.installProvider(provider);
  serve();
  const auto coordinator = makeCoordinator();
  auto claim = coordinator->write(itemURL(provider, "report"));
  ASSERT_TRUE(claim) << claim.error().message();
  session.write(session.storage(provider) / "report", "new");
  expectHeld(std::move(claim));
  EXPECT_TRUE(daemon->waitForLine("changed report"));
  EXPECT_EQ(0U, daemon->countLines("called start"));

  // A scope that goes does the same, and so does a coordinator that goes right after it.
  { ASSERT_TRUE(makeCoordinator()->write(itemURL(provider, "folder/other"))); }
  EXPECT_TRUE(daemon->waitForLine("changed folder/other"));
}

TEST_F(Coordination, ExtensionIsNotCalledBackForWhatItDoesItself) {
  // A confined extension sees no socket of the daemon's.
  session.environment["STORIX_CONFINEMENT"] = "off";
  const std::string own = (session.storage(provider) / "report").string();
  session.installProvider(provider, "start claim " + own);
  serve();
  expectHeld(makeCoordinator()->read(itemURL(provider, "report"), {.deadline = patience}));
  EXPECT_EQ(1U, daemon->countLines("claimed")) << "neither waited for itself nor for its reader";
  EXPECT_EQ(0U, daemon->countLines("not claimed"));
  EXPECT_EQ(1U, daemon->countLines("called start"));
  // Were it told of its own write, it would be before this one.
  expectHeld(makeCoordinator()->write(itemURL(provider, "other")));
  ASSERT_TRUE(daemon->waitForLine("changed other"));
  EXPECT_EQ(1U, daemon->countLines("called changed"));
}

TEST_F(Coordination, ProvidersRefusalReachesTheReaderAndNothingIsClaimed) {
  session.installProvider(provider, "start fail no disk today");
  serve();
  const auto coordinator = makeCoordinator();
  const auto claim = coordinator->read(itemURL(provider, "report"));
  ASSERT_FALSE(claim);
  EXPECT_EQ(storixErrorDomain, claim.error().domain());
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::pluginOperationFailed), claim.error().code());
  ASSERT_NE(nullptr, claim.error().underlyingError());
  EXPECT_EQ("no disk today", claim.error().underlyingError()->message());
  expectHeld(coordinator->write(itemURL(provider, "report"), {.deadline = patience}));
}

TEST_F(Coordination, ProviderThatNeverAnswersHoldsUpItsReadersAlone) {
  session.installProvider(provider, "start never");
  session.installProvider("org.sample.well");
  serve();
  const auto coordinator = makeCoordinator();
  expectTimedOut(coordinator->read(itemURL(provider, "report"), {.deadline = impatience}));

  const auto killed =
      std::make_unique<Process>(std::vector<std::string>{builtProgram("e2e_claim_holder").string(), "read",
                                                         itemURL(provider, "other").absoluteString()},
                                session.environment);
  ASSERT_TRUE(daemon->waitForLine("called start", *daemon->waitForLine("called start") + 1));
  kill(*killed);

  expectHeld(coordinator->read(itemURL("org.sample.well", "report"), {.deadline = patience}));
  expectHeld(coordinator->write(itemURL(provider, "report"), {.deadline = patience}));
  EXPECT_FALSE(makeClient()->wakeUp());
  stop();
}

TEST_F(Coordination, ThousandReadersOfOneItemAreServedByOneDownload) {
  // Where a confined extension sees it.
  const fs::path container = session.storage(provider).parent_path();
  fs::create_directories(container);
  const fs::path gate = container / "gate";
  ASSERT_EQ(0, ::mkfifo(gate.c_str(), 0600));
  session.installProvider(provider, "start hold " + gate.string());
  serve();
  const std::string url = itemURL(provider, "report").absoluteString();
  constexpr std::size_t connections = 8;
  constexpr std::size_t each = 125;
  std::vector<std::unique_ptr<BareClient>> readers;
  for (std::size_t i = 0; i < connections; ++i) {
    readers.push_back(makeBareClient());
    for (std::size_t j = 0; j < each; ++j) readers.back()->send("BeginRead", url);
    // Requests of one connection are taken in their order.
    EXPECT_EQ("com.tessel.Platform.Error.NoSuchClaim", readers.back()->call("EndRead", "t", std::uint64_t{0}));
  }
  ASSERT_TRUE(daemon->waitForLine("holding start"));
  const auto others = makeCoordinator();
  expectHeld(others->write(plainFile("a"), {.deadline = patience}));
  std::ofstream(gate) << "go";

  std::set<std::uint64_t> claims;
  for (const auto &reader : readers) {
    for (const BareClient::Begun &begun : reader->answers(each)) {
      ASSERT_TRUE(begun.claim) << begun.errorName << begun.providerError;
      claims.insert(*begun.claim);
    }
  }
  EXPECT_EQ(connections * each, claims.size());
  EXPECT_EQ(1U, daemon->countLines("called start"));
  readers.clear();
  expectHeld(others->write(itemURL(provider, "report"), {.deadline = patience}));
}

TEST_F(Coordination, ThousandReadersOfOneProcessAreServed) {
  session.installProvider(provider);
  serve();
  constexpr std::size_t count = 1000;
  const auto coordinator = makeCoordinator();
  std::mutex mutex;
  std::vector<FileClaim> held;
  std::promise<void> all;
  std::size_t answered = 0;
  for (std::size_t i = 0; i < count; ++i) {
    coordinator->read(itemURL(provider, "report"), {.deadline = patience}, [&](Result<FileClaim> claim) {
      const std::lock_guard lock(mutex);
      EXPECT_TRUE(claim) << claim.error().message();
      if (claim) held.push_back(std::move(claim.value()));
      if (++answered == count) all.set_value();
    });
  }
  all.get_future().wait();
  EXPECT_EQ(count, held.size());
  expectTimedOut(makeCoordinator()->write(itemURL(provider, "report"), {.deadline = impatience}));
  held.clear();
  expectHeld(makeCoordinator()->write(itemURL(provider, "report"), {.deadline = patience}));
}

// --- Any files

TEST_F(Coordination, ReadersShareAFileAndWritersHaveItAlone) {
  serve();
  const auto one = makeCoordinator();
  const auto other = makeCoordinator();
  const URL file = plainFile("a");
  auto reader = one->read(file);
  ASSERT_TRUE(reader);
  expectHeld(other->read(file, {.deadline = patience}));
  expectTimedOut(other->write(file, {.deadline = impatience}));
  expectHeld(std::move(reader));

  auto writer = other->write(file, {.deadline = patience});
  ASSERT_TRUE(writer) << writer.error().message();
  expectTimedOut(one->read(file, {.deadline = impatience}));
  expectTimedOut(one->write(file, {.deadline = impatience}));
  expectHeld(std::move(writer));
  expectHeld(one->write(file, {.deadline = patience}));
}

TEST_F(Coordination, DirectoryStandsForAllThatLiesInIt) {
  serve();
  const auto coordinator = makeCoordinator();
  const URL directory = *URL::fileURLWithPath((session.directory() / "plain/folder").string(), true);
  const URL below = plainFile("folder/deep/file");
  const URL beside = plainFile("folder.txt");

  auto whole = coordinator->write(directory);
  ASSERT_TRUE(whole);
  expectTimedOut(coordinator->read(below, {.deadline = impatience}));
  expectHeld(coordinator->write(beside, {.deadline = patience}));
  expectHeld(std::move(whole));

  auto part = coordinator->read(below);
  ASSERT_TRUE(part);
  expectTimedOut(coordinator->write(directory, {.deadline = impatience}));
  expectHeld(coordinator->read(directory, {.deadline = patience}));
  expectHeld(std::move(part));
  expectHeld(coordinator->write(directory, {.deadline = patience}));
}

TEST_F(Coordination, ClaimsAreGivenInTheOrderInWhichTheyCame) {
  serve();
  const std::string file = plainFile("a").absoluteString();
  const auto holder = makeBareClient();
  const auto waiting = makeBareClient();
  const auto first = holder->begin("BeginRead", file);
  ASSERT_TRUE(first.claim);
  waiting->send("BeginWrite", file);
  waiting->send("BeginRead", file);
  EXPECT_EQ("com.tessel.Platform.Error.NoSuchClaim", waiting->call("EndRead", "t", std::uint64_t{0}));

  EXPECT_EQ("", holder->call("EndRead", "t", *first.claim));
  const auto writer = waiting->answers(1);
  ASSERT_EQ(1U, writer.size()) << "the reader, which the first one would not have been in the way of, waits its turn";
  ASSERT_TRUE(writer.front().claim);
  EXPECT_EQ("", waiting->call("EndWrite", "t", *writer.front().claim)) << "it is the writer's";
  const auto reader = waiting->answers(1);
  ASSERT_EQ(1U, reader.size());
  ASSERT_TRUE(reader.front().claim);
  EXPECT_EQ("", waiting->call("EndRead", "t", *reader.front().claim));
}

// --- Those who go, hang and give up

TEST_F(Coordination, ClaimsOfAProcessThatIsKilledEnd) {
  serve();
  const auto coordinator = makeCoordinator();
  for (const char *kind : {"read", "write"}) {
    const std::unique_ptr<Process> killed = holder(kind, plainFile("a"));
    std::promise<Result<FileClaim>> answer;
    coordinator->write(plainFile("a"), {.deadline = patience},
                       [&answer](Result<FileClaim> claim) { answer.set_value(std::move(claim)); });
    kill(*killed);
    expectHeld(answer.get_future().get());
  }
}

TEST_F(Coordination, WriterThatHangsIsWaitedForUntilTheDeadlineOrItsEnd) {
  serve();
  const auto coordinator = makeCoordinator();
  const std::unique_ptr<Process> hanging = holder("write", plainFile("a"));
  hanging->signal(SIGSTOP);
  const auto claim = coordinator->read(plainFile("a"), {.deadline = impatience});
  expectTimedOut(claim);
  EXPECT_EQ("The document broker did not answer in time.", claim.error().message());
  expectHeld(coordinator->write(plainFile("b"), {.deadline = patience}));
  kill(*hanging);
  expectHeld(coordinator->read(plainFile("a"), {.deadline = patience}));
}

TEST_F(Coordination, WriterThatGaveUpIsNotInAnybodysWay) {
  serve();
  const auto coordinator = makeCoordinator();
  auto reader = coordinator->read(plainFile("a"));
  ASSERT_TRUE(reader);
  expectTimedOut(coordinator->write(plainFile("a"), {.deadline = impatience}));
  expectHeld(coordinator->read(plainFile("a"), {.deadline = patience}));

  std::stop_source stop;
  std::promise<Result<FileClaim>> answer;
  coordinator->write(plainFile("a"), {.cancellation = stop.get_token()},
                     [&answer](Result<FileClaim> claim) { answer.set_value(std::move(claim)); });
  stop.request_stop();
  const Result<FileClaim> cancelled = answer.get_future().get();
  ASSERT_FALSE(cancelled);
  EXPECT_TRUE(isClientError(cancelled.error(), ClientErrorCode::cancelled)) << cancelled.error().message();
  expectHeld(coordinator->read(plainFile("a"), {.deadline = patience}));
  EXPECT_TRUE(reader.value().isHeld());
}

TEST_F(Coordination, ClaimIsLostWithTheDaemonAndTheNextOneIsMadeWithTheNewDaemon) {
  serve();
  const auto coordinator = makeCoordinator();
  auto claim = coordinator->write(plainFile("a"));
  ASSERT_TRUE(claim);
  std::promise<SXError> failed;
  coordinator->read(plainFile("a"), {},
                    [&failed](const Result<FileClaim> &waiting) { failed.set_value(waiting.error()); });
  daemon->signal(SIGKILL);
  daemon->wait();
  const SXError error = failed.get_future().get();
  EXPECT_TRUE(isClientError(error, ClientErrorCode::connectionLost) ||
              isClientError(error, ClientErrorCode::notReachable))
      << error.message();
  const auto ended = claim.value().end();
  ASSERT_TRUE(ended);
  EXPECT_TRUE(isClientError(*ended, ClientErrorCode::connectionLost)) << ended->message();
  EXPECT_TRUE(claim.value().lost());
  const auto none = coordinator->read(plainFile("a"));
  ASSERT_FALSE(none);
  EXPECT_TRUE(isClientError(none.error(), ClientErrorCode::notReachable)) << none.error().message();
  serve();
  expectHeld(coordinator->read(plainFile("a")));
}

// --- Requests that make no sense

TEST_F(Coordination, ClaimIsEndedOnceByItsConnectionAsWhatItIs) {
  serve();
  const auto client = makeBareClient();
  const auto stranger = makeBareClient();
  const std::string noSuchClaim = "com.tessel.Platform.Error.NoSuchClaim";
  const std::string file = plainFile("a").absoluteString();
  const auto reader = client->begin("BeginRead", file);
  ASSERT_TRUE(reader.claim);
  EXPECT_EQ(noSuchClaim, stranger->call("EndRead", "t", *reader.claim)) << "somebody else's";
  EXPECT_EQ(noSuchClaim, client->call("EndWrite", "t", *reader.claim)) << "of the other kind";
  EXPECT_EQ(noSuchClaim, client->call("EndRead", "t", *reader.claim + 1)) << "unknown";
  EXPECT_EQ("", client->call("EndRead", "t", *reader.claim));
  EXPECT_EQ(noSuchClaim, client->call("EndRead", "t", *reader.claim)) << "twice";

  const auto writer = client->begin("BeginWrite", file);
  ASSERT_TRUE(writer.claim);
  EXPECT_EQ(noSuchClaim, client->call("EndRead", "t", *writer.claim));
  EXPECT_EQ(noSuchClaim, stranger->call("EndWrite", "t", *writer.claim));
  stranger->send("BeginRead", file);
  EXPECT_EQ("", client->call("EndWrite", "t", *writer.claim)) << "it was held through all that";
  EXPECT_TRUE(stranger->answers(1).at(0).claim);
}

TEST_F(Coordination, OnlyAbsoluteFileURLsAreClaimed) {
  serve();
  const auto client = makeBareClient();
  for (const char *method : {"BeginRead", "BeginWrite"}) {
    for (const char *url : {"", "report", "/tmp/report", "./report", "file:relative", "file://host/report",
                            "http://host/report", "file:///a%00b", "file:///a%2", "file:///a b"}) {
      const auto begun = client->begin(method, url);
      EXPECT_EQ(SD_BUS_ERROR_INVALID_ARGS, begun.errorName) << url;
      EXPECT_NE(std::string::npos, begun.errorText.find("URL")) << begun.errorText;
    }
  }
  EXPECT_EQ(SD_BUS_ERROR_INVALID_ARGS, client->call("BeginRead", "s", "file:///a"));
  EXPECT_EQ(SD_BUS_ERROR_INVALID_ARGS, client->call("EndRead", "s", "1"));
  EXPECT_TRUE(client->begin("BeginRead", plainFile("a").absoluteString()).claim);
}

TEST_F(Coordination, LoopOfLinksIsRefusedWithTheReason) {
  serve();
  fs::create_directory(session.directory() / "plain");
  fs::create_symlink("two", session.directory() / "plain/one");
  fs::create_symlink("one", session.directory() / "plain/two");
  const auto coordinator = makeCoordinator();
  for (const char *name : {"one", "one/below"}) {
    for (const bool writing : {false, true}) {
      const auto claim =
          writing ? coordinator->write(plainFile(name)) : coordinator->read(plainFile(name), {.deadline = patience});
      ASSERT_FALSE(claim) << name;
      EXPECT_TRUE(isClientError(claim.error(), ClientErrorCode::refused));
      EXPECT_EQ("com.tessel.Platform.Error.Unavailable", claim.error().stringDetail("name"));
      EXPECT_NE(std::string::npos, claim.error().message().find("symbolic links")) << claim.error().message();
    }
  }
  expectHeld(coordinator->read(plainFile("three")));
}

TEST_F(Coordination, FileByAnotherNameIsTheSameFile) {
  serve();
  fs::create_directory(session.directory() / "plain");
  session.write(session.directory() / "plain/file", "");
  fs::create_symlink("file", session.directory() / "plain/link");
  const auto coordinator = makeCoordinator();
  auto writer = coordinator->write(plainFile("link"));
  ASSERT_TRUE(writer);
  expectTimedOut(coordinator->read(plainFile("file"), {.deadline = impatience}));
  expectHeld(std::move(writer));
}

TEST_F(Coordination, ClientWithTooManyClaimsIsToldAndKeepsThoseThatItHas) {
  serve();
  const auto client = makeBareClient();
  const std::string file = plainFile("a").absoluteString();
  std::uint64_t last = 0;
  for (int i = 0; i < 4096; ++i) {
    const auto begun = client->begin("BeginRead", file);
    ASSERT_TRUE(begun.claim) << i << begun.errorName;
    last = *begun.claim;
  }
  EXPECT_EQ("com.tessel.Platform.Error.Busy", client->begin("BeginRead", file).errorName);
  expectTimedOut(makeCoordinator()->write(plainFile("a"), {.deadline = impatience}));
  EXPECT_EQ("", client->call("EndRead", "t", last));
  EXPECT_TRUE(client->begin("BeginRead", file).claim);
}

}  // namespace
}  // namespace storix::e2e
