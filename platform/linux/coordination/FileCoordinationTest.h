#pragma once

#include <gmock/gmock.h>
#include <sys/socket.h>
#include <unistd.h>

#include <utility>
#include <vector>

#include "platform/ManualExecutor.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/TestDirectory.h"
#include "platform/linux/coordination/FileCoordination.h"
#include "platform/linux/identity/ApplicationManifests.h"

namespace storix::linuxhost {

inline URL urlOf(const std::string &path, bool isDirectory = false) { return *URL::fileURLWithPath(path, isDirectory); }

/// A provider object in this process that the test answers for.
class ScriptedProvider : public KTStorix {
 public:
  ScriptedProvider(Executor &executor, std::optional<URL> url, std::string identifier = "org.sample.docs")
      : queue(OperationQueue::create(executor, "Operation queue for " + identifier)),
        url_(std::move(url)),
        identifier_(std::move(identifier)) {}

  std::optional<URL> _providedItemsURL() override { return url_; }
  std::shared_ptr<OperationQueue> _providedItemsOperationQueue() override { return queue; }
  std::optional<std::string> _fileReactorID() override { return identifier_; }
  [[nodiscard]] bool answers(OptionalMember member) const override {
    switch (member) {
      case OptionalMember::provideItemAtURLToReaderWithID:
        return answersReaderForm;
      case OptionalMember::writerWithIDDidFinishWritingForURL:
        return answersWriter;
      case OptionalMember::fileReactorID:
        return true;
      default:
        return false;
    }
  }
  void _provideItemAtURL(std::optional<URL> url, Completion completionHandler) override {
    note("old form " + url->absoluteString());
    completions.push_back(std::move(completionHandler));
  }
  void _provideItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID,
                         Completion completionHandler) override {
    note("provide " + url->absoluteString() + " to " + toReaderWithID.value_or("nobody"));
    completions.push_back(std::move(completionHandler));
  }
  void _writerWithID(std::optional<std::string> writerID, std::optional<URL> didFinishWritingForURL) override {
    note("written " + didFinishWritingForURL->absoluteString() + " by " + writerID.value_or("nobody"));
  }

  std::vector<std::string> takeCalls() { return std::exchange(calls, {}); }

  std::shared_ptr<OperationQueue> queue;
  bool answersReaderForm = true;
  bool answersWriter = true;
  std::vector<std::string> calls;
  std::vector<Completion> completions;

 private:
  void note(std::string call) {
    EXPECT_EQ(OperationQueue::current(), queue.get());
    calls.push_back(std::move(call));
  }

  std::optional<URL> url_;
  std::string identifier_;
};

/// What one begin has come to.
struct Begun {
  std::optional<ClaimOutcome> outcome;

  [[nodiscard]] bool isHeld() const { return outcome && std::holds_alternative<ClaimIdentifier>(*outcome); }
  [[nodiscard]] ClaimIdentifier claim() const { return isHeld() ? std::get<ClaimIdentifier>(*outcome) : 0; }
  [[nodiscard]] std::optional<SXError> error() const {
    if (!outcome || !std::holds_alternative<SXError>(*outcome)) return std::nullopt;
    return std::get<SXError>(*outcome);
  }
  [[nodiscard]] std::optional<CoordinationFailure::Kind> failure() const {
    if (!outcome || !std::holds_alternative<CoordinationFailure>(*outcome)) return std::nullopt;
    return std::get<CoordinationFailure>(*outcome).kind;
  }
};

class FileCoordinationTest : public testing::Test {
 protected:
  FileCoordinationTest() : coordination_(std::make_unique<FileCoordination>(executor_, isProviderProcess())) {
    directory_.makeDirectory("storage");
    provider_ = makeProvider("storage");
    coordination_->addProvider(provider_);
    claims_ = coordination_->claimsOf(nullptr);
    others_ = coordination_->claimsOf(nullptr);
  }

  FileCoordination::IsProviderProcess isProviderProcess() {
    return [this](const std::string &identifier, pid_t process) {
      return identifier == ownProvider_ && process == ::getpid();
    };
  }

  std::shared_ptr<ScriptedProvider> makeProvider(const std::string &name, std::string identifier = "org.sample.docs") {
    return std::make_shared<ScriptedProvider>(executor_, urlOf(directory_ / name, true), std::move(identifier));
  }

  [[nodiscard]] URL file(const std::string &name) const { return urlOf(directory_ / name); }
  [[nodiscard]] std::string text(const std::string &name) const { return file(name).absoluteString(); }

  static ClaimHandler into(const std::shared_ptr<Begun> &begun) {
    return [begun](ClaimOutcome outcome) {
      EXPECT_FALSE(begun->outcome.has_value()) << "answered twice";
      begun->outcome = std::move(outcome);
    };
  }

  /// Both run all that can be run.
  std::shared_ptr<Begun> read(FileClaims &claims, const URL &url, std::optional<std::string> reader = std::nullopt) {
    auto begun = std::make_shared<Begun>();
    claims.beginRead(url, std::move(reader), into(begun));
    EXPECT_FALSE(begun->outcome) << "answered inside the call";
    executor_.runUntilIdle();
    return begun;
  }
  std::shared_ptr<Begun> write(FileClaims &claims, const URL &url, std::optional<std::string> writer = std::nullopt) {
    auto begun = std::make_shared<Begun>();
    claims.beginWrite(url, std::move(writer), into(begun));
    EXPECT_FALSE(begun->outcome) << "answered inside the call";
    executor_.runUntilIdle();
    return begun;
  }

  void answer(std::size_t question, const std::optional<SXError> &error) {
    provider_->completions.at(question)(error);
    executor_.runUntilIdle();
  }

  /// A peer that is this very process.
  static std::shared_ptr<const Peer> ownPeer() {
    static PeerTable table(std::make_shared<ApplicationManifests>(std::vector<std::string>()));
    int ends[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd one(ends[0]);
    const UniqueFd other(ends[1]);
    Result<std::shared_ptr<Peer>> peer = table.admit(one.get());
    EXPECT_TRUE(peer.ok());
    return peer ? peer.value() : nullptr;
  }

  TestDirectory directory_;
  ManualExecutor executor_;
  std::string ownProvider_;
  std::unique_ptr<FileCoordination> coordination_;
  std::shared_ptr<ScriptedProvider> provider_;
  std::unique_ptr<FileClaims> claims_;
  std::unique_ptr<FileClaims> others_;
};

}  // namespace storix::linuxhost
