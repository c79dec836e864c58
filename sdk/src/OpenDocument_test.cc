#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <mutex>
#include <string>
#include <vector>

#include "sdk/src/TestDaemon.h"
#include "storix/Client.h"
#include "wire/PlatformInterfaces.h"

namespace storix {
namespace {

using ::testing::ElementsAre;
using Reply = wire::BusConnection::Reply;

/// A daemon that resolves, claims and opens as it should, and what was asked of it in which order.
class OpenDocumentTest : public ::testing::Test {
 protected:
  OpenDocumentTest() {
    daemon_.daemon->onDocumentURL = [this](const std::string &string, const SXDaemon::DocumentReply &reply) {
      note("resolve " + string);
      reply(document_, token_, std::nullopt, std::nullopt, std::nullopt);
    };
    daemon_.onBeginRead = [this](const wire::MethodValues &values, const Reply &reply) {
      note("read by " + std::get<std::optional<std::string>>(values.at(1)).value_or("nobody"));
      give(reply, 1);
    };
    daemon_.onBeginWrite = [this](const wire::MethodValues &values, const Reply &reply) {
      note("write by " + std::get<std::optional<std::string>>(values.at(1)).value_or("nobody"));
      give(reply, 2);
    };
    daemon_.onConsume = [this](const wire::MethodValues &values, const Reply &reply) {
      note("open " + std::get<Data>(values.at(0)).bytes);
      if (!opens_) return reply.fail(wire::platformError::unavailable, "not there yet");
      wire::MethodValues answer;
      answer.emplace_back(UniqueFd(::open("/dev/null", O_RDWR | O_CLOEXEC)));
      reply.send(std::move(answer));
    };
    daemon_.onEndRead = [this](const wire::MethodValues &, const Reply &reply) {
      reply.send({});
      readEnded_.set_value();
    };
    daemon_.onEndWrite = [this](const wire::MethodValues &, const Reply &reply) {
      note("end of write");
      reply.send({});
      writeEnded_.set_value();
    };
  }

  static void give(const Reply &reply, std::uint64_t number) {
    wire::MethodValues values;
    values.emplace_back(std::optional<SXError>());
    values.emplace_back(std::optional<std::uint64_t>(number));
    reply.send(std::move(values));
  }

  void note(std::string step) {
    const std::lock_guard lock(mutex_);
    steps_.push_back(std::move(step));
  }
  std::vector<std::string> steps() {
    const std::lock_guard lock(mutex_);
    return steps_;
  }

  ClientOptions options(std::chrono::milliseconds timeout = std::chrono::seconds(60)) {
    return {daemon_.directory(), timeout};
  }

  const URL document_ = *URL::fileURLWithPath("/storage/a");
  std::optional<Data> token_ = Data{"token"};
  bool opens_ = true;
  std::promise<void> readEnded_;
  std::promise<void> writeEnded_;
  std::mutex mutex_;
  std::vector<std::string> steps_;
  sdk::TestDaemon daemon_;
};

TEST_F(OpenDocumentTest, ForReadingItIsResolvedClaimedOpenedAndLetGo) {
  Client client(options());
  const auto opened = client.openDocument("storix:p/i", {.identifier = "org.sample.reader"});
  ASSERT_TRUE(opened) << opened.error().message();
  EXPECT_EQ(opened.value().document.url, document_);
  EXPECT_TRUE(opened.value().descriptor);
  EXPECT_FALSE(opened.value().claim.isHeld());
  readEnded_.get_future().wait();
  EXPECT_THAT(steps(), ElementsAre("resolve storix:p/i", "read by org.sample.reader", "open token"));
}

TEST_F(OpenDocumentTest, ForWritingItIsReadFirstAndThenHeldUntilTheClaimEnds) {
  Client client(options());
  auto opened = client.openDocumentForWriting("storix:p/i", {.identifier = "org.sample.writer"});
  ASSERT_TRUE(opened) << opened.error().message();
  EXPECT_TRUE(opened.value().descriptor);
  readEnded_.get_future().wait();
  EXPECT_THAT(steps(), ElementsAre("resolve storix:p/i", "read by org.sample.writer", "write by org.sample.writer",
                                   "open token"));
  EXPECT_TRUE(opened.value().claim.isHeld());
  EXPECT_EQ(opened.value().claim.end(), std::nullopt);
  EXPECT_EQ(steps().back(), "end of write");
}

TEST_F(OpenDocumentTest, WhatCannotBeOpenedIsHeldByNobody) {
  opens_ = false;
  Client client(options());
  const auto opened = client.openDocumentForWriting("storix:p/i");
  ASSERT_FALSE(opened);
  EXPECT_TRUE(isClientError(opened.error(), ClientErrorCode::refused));
  EXPECT_EQ(opened.error().stringDetail("name"), std::string(wire::platformError::unavailable));
  writeEnded_.get_future().wait();
}

TEST_F(OpenDocumentTest, WithoutATokenTheAnswerIsIncomplete) {
  token_.reset();
  Client client(options());
  const auto opened = client.openDocument("storix:p/i");
  ASSERT_FALSE(opened);
  EXPECT_TRUE(isClientError(opened.error(), ClientErrorCode::incompleteAnswer)) << opened.error().message();
  readEnded_.get_future().wait();
}

TEST_F(OpenDocumentTest, TheDaemonsAndTheProvidersErrorsComeUnchanged) {
  const SXError unknown = SXInvalidBookmarkableStringError();
  const SXError offline("org.sample", 7, {{"description", "no network"}});
  daemon_.onBeginRead = [&offline](const wire::MethodValues &, const Reply &reply) {
    wire::MethodValues values;
    values.emplace_back(std::optional<SXError>(offline));
    values.emplace_back(std::optional<std::uint64_t>());
    reply.send(std::move(values));
  };
  daemon_.daemon->onDocumentURL = [this, &unknown](const std::string &string, const SXDaemon::DocumentReply &reply) {
    if (string.empty()) return reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, unknown);
    reply(document_, token_, std::nullopt, std::nullopt, std::nullopt);
  };
  Client client(options());
  EXPECT_EQ(client.openDocument("").error(), unknown);
  EXPECT_EQ(client.openDocument("storix:p/i").error(), offline);
  EXPECT_TRUE(steps().empty());
}

TEST_F(OpenDocumentTest, TheDeadlineIsForAllOfItAndElseTheClientsTimeout) {
  daemon_.onBeginRead = [](const wire::MethodValues &, const Reply &) {};
  Client client(options());
  const auto late = client.openDocument("storix:p/i", {.deadline = std::chrono::milliseconds(100)});
  EXPECT_TRUE(isClientError(late.error(), ClientErrorCode::timedOut)) << late.error().message();
  Client impatient(options(std::chrono::milliseconds(100)));
  const auto alsoLate = impatient.openDocument("storix:p/i");
  EXPECT_TRUE(isClientError(alsoLate.error(), ClientErrorCode::timedOut)) << alsoLate.error().message();
}

TEST_F(OpenDocumentTest, CancellationEndsItWhereverItIs) {
  std::promise<void> asked;
  daemon_.daemon->onDocumentURL = [&asked](const std::string &, const SXDaemon::DocumentReply &) { asked.set_value(); };
  Client client(options());
  std::stop_source stop;
  std::promise<SXError> failed;
  client.openDocument("storix:p/i", {.cancellation = stop.get_token()},
                      [&failed](const Result<OpenedDocument> &opened) { failed.set_value(opened.error()); });
  asked.get_future().wait();
  stop.request_stop();
  EXPECT_TRUE(isClientError(failed.get_future().get(), ClientErrorCode::cancelled));
}

TEST_F(OpenDocumentTest, DestroyingTheClientAnswersIt) {
  daemon_.onBeginRead = [](const wire::MethodValues &, const Reply &) {};
  std::promise<SXError> failed;
  {
    Client client(options());
    client.openDocument("storix:p/i", {},
                        [&failed](const Result<OpenedDocument> &opened) { failed.set_value(opened.error()); });
  }
  auto answered = failed.get_future();
  ASSERT_EQ(answered.wait_for(std::chrono::seconds(0)), std::future_status::ready);
  EXPECT_TRUE(isClientError(answered.get(), ClientErrorCode::connectionLost));
}

}  // namespace
}  // namespace storix
