#include "wire/BusConnectionTest.h"

namespace storix::wire {
namespace {

using testing::Contains;
using testing::HasSubstr;

class ConnectionTest : public EachFramingTest {};

INSTANTIATE_TEST_SUITE_P(Wire, ConnectionTest, EachFramingTest::each(), EachFramingTest::name);

TEST_P(ConnectionTest, EveryKindTravelsBothWays) {
  exportDaemon(object_);
  const URL url = *URL::fromString("file:///a%20b/%C3%A9");
  remote()->send(rowOf("ExtendSandboxForFileURL"), {Value(url), Value("org.sample"), std::nullopt}, toReplies());
  auto request = object_->requests.take();
  ASSERT_TRUE(request);
  EXPECT_EQ(request->operation, rowOf("ExtendSandboxForFileURL"));
  EXPECT_EQ(request->arguments, (Arguments{Value(url), Value("org.sample"), std::nullopt}));

  const SXError error("domain", -7,
                      {{"description", Value("text")},
                       {"underlyingError", Value(SXError("other", 1))},
                       {"list", Value(List{Value(1), Value(true), Value(2.5), Value(Data{"xy"})})},
                       {"URL", Value(url)}});
  const Arguments answer{Value(error), Value(Data{std::string("\0\1token", 7)}), Value(url), Value(Data{})};
  request->reply(answer);
  EXPECT_EQ(replies_.take(), answer);
}

TEST_P(ConnectionTest, AnEmptyStringIsNotAnAbsentOne) {
  exportDaemon(object_);
  remote()->send(rowOf("StartProvidingItemAtURL"), {std::nullopt, Value(""), std::nullopt}, toReplies());
  auto request = object_->requests.take();
  ASSERT_TRUE(request);
  EXPECT_EQ(request->arguments, (Arguments{std::nullopt, Value(""), std::nullopt}));
  request->reply({std::nullopt});
  EXPECT_EQ(replies_.take(), Arguments{std::nullopt});
}

TEST_P(ConnectionTest, RepliesComeLaterFromOtherThreadsAndInAnyOrder) {
  exportDaemon(object_);
  const auto remoteObject = remote();
  constexpr int count = 20;
  std::vector<RecordingObject::Request> requests;
  requests.reserve(count);
  for (int i = 0; i < count; ++i) {
    remoteObject->send(rowOf("DocumentURLFromBookmarkableString"), {Value(std::to_string(i))}, toReplies());
  }
  for (int i = 0; i < count; ++i) {
    auto request = object_->requests.take();
    ASSERT_TRUE(request);
    EXPECT_EQ(request->arguments[0], Value(std::to_string(i))) << "requests are handed over in order";
    requests.push_back(std::move(*request));
  }
  std::vector<std::thread> threads;
  threads.reserve(requests.size());
  for (auto &request : requests) {
    threads.emplace_back([&request] { request.reply({{}, {}, {}, {}, Value(SXInvalidBookmarkableStringError())}); });
  }
  for (std::thread &thread : threads) thread.join();
  for (int i = 0; i < count; ++i) {
    EXPECT_EQ(replies_.take(), (Arguments{{}, {}, {}, {}, Value(SXInvalidBookmarkableStringError())}));
  }
}

TEST_P(ConnectionTest, SecondReplyIsDropped) {
  exportDaemon(object_);
  remote()->send(rowOf("WakeUp"), {}, toReplies());
  auto request = object_->requests.take();
  ASSERT_TRUE(request);
  request->reply({});
  request->reply({});
  remote()->send(rowOf("WakeUp"), {}, toReplies());
  auto second = object_->requests.take();
  ASSERT_TRUE(second);
  second->reply({});
  EXPECT_TRUE(replies_.take());
  EXPECT_TRUE(replies_.take());
  EXPECT_EQ(replies_.count(), 0U);
}

TEST_P(ConnectionTest, CallWithoutReplyIsARequestWithoutReplyHandler) {
  exportDaemon(object_);
  remote()->send(rowOf("WakeUp"), {}, {});
  auto request = object_->requests.take();
  ASSERT_TRUE(request);
  EXPECT_FALSE(request->reply);
}

TEST_P(ConnectionTest, EachMessageInFlightHearsOnceThatThePeerIsGone) {
  exportDaemon(object_);
  const auto remoteObject = remote();
  Received<SXError> clientClosed;
  constexpr int count = 3;
  for (int i = 0; i < count; ++i) remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  std::vector<RecordingObject::Request> requests;
  requests.reserve(count);
  for (int i = 0; i < count; ++i) requests.push_back(*object_->requests.take());
  (*server_)->close();
  for (int i = 0; i < count; ++i) {
    auto error = errors_.take();
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), posixErrorDomain);
    EXPECT_EQ(error->code(), ECONNRESET);
    EXPECT_THAT(error->message(), HasSubstr("WakeUp"));
  }
  client_->join();
  // Replies after the end are harmless.
  for (auto &request : requests) request.reply({});
  EXPECT_EQ(errors_.count(), 0U);
  EXPECT_EQ(replies_.count(), 0U);
  EXPECT_TRUE(closed_.take());
}

TEST_P(ConnectionTest, MessageToAConnectionThatHasEndedFailsOutsideTheCall) {
  exportDaemon(object_);
  const auto remoteObject = remote();
  client()->close();
  client_->join();
  // A call on this thread would find the mutex locked for ever.
  const auto inCall = std::make_shared<std::mutex>();
  std::unique_lock held(*inCall);
  const auto other = client()->remoteObject(LinkInterface(daemonProtocol()), [this, inCall](SXError error) {
    const std::lock_guard lock(*inCall);
    errors_.put(error);
  });
  other->send(rowOf("WakeUp"), {}, toReplies());
  held.unlock();
  EXPECT_TRUE(errors_.take());
}

TEST_P(ConnectionTest, DBusErrorReplyReachesTheErrorHandlerAndSaysWhich) {
  server_->start();
  remote()->send(rowOf("WakeUp"), {}, toReplies());
  auto error = errors_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->stringDetail("busError"), "org.freedesktop.DBus.Error.UnknownObject");
  EXPECT_THAT(error->message(), HasSubstr(daemonPath));
}

TEST_P(ConnectionTest, ReplyOfAnotherSignatureReachesTheErrorHandler) {
  static const InterfaceDescription wrong{
      "com.tessel.Storix.Daemon", "/com/tessel/Storix", {{"WakeUp", {}, {{"surprise", "t"}}}}};
  (*server_)->exportMethods(wrong, {[](MethodValues, const BusConnection::Reply &reply) {
                              MethodValues values;
                              values.emplace_back(std::uint64_t{1});
                              reply.send(std::move(values));
                            }});
  server_->start();
  remote()->send(rowOf("WakeUp"), {}, toReplies());
  auto error = errors_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->stringDetail("busError"), busErrorName::invalidArgs);
  EXPECT_THAT(error->message(), HasSubstr("signature"));
  EXPECT_THAT(logTexts(), Contains(HasSubstr("Refused the reply to \"WakeUp\" from the daemon")));
}

TEST_P(ConnectionTest, ReplyWithAKindThatIsNotPermittedIsWithheld) {
  const Dictionary record{{"org.sample", Value(Dictionary{{"count", Value(1)}})}};
  exportDaemon(std::make_shared<AnsweringObject>(Arguments{std::nullopt, Value(record)}));
  remote()->send(rowOf("Providers"), {}, toReplies());
  auto error = errors_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->stringDetail("busError"), busErrorName::invalidArgs);
  EXPECT_THAT(logTexts(), Contains(HasSubstr("Withheld the reply to \"Providers\" of pid 42")));
}

TEST_P(ConnectionTest, PermittedKindsPass) {
  const URL url = *URL::fromString("file:///a/");
  const Dictionary record{{"org.sample", Value(Dictionary{{"name", Value("n")}, {"URL", Value(url)}})}};
  exportDaemon(std::make_shared<AnsweringObject>(Arguments{std::nullopt, Value(record)}));
  remote()->send(rowOf("Providers"), {}, toReplies());
  EXPECT_EQ(replies_.take(), (Arguments{std::nullopt, Value(record)}));
}

TEST_P(ConnectionTest, ReplyThatIsTooLargeIsAnErrorAndTheConnectionLives) {
  exportDaemon(object_);
  remote()->send(rowOf("ExtendSandboxForFileURL"), {{}, {}, {}}, toReplies());
  auto request = object_->requests.take();
  ASSERT_TRUE(request);
  request->reply({std::nullopt, Value(Data{std::string(maximumMessageSize, 'x')}), std::nullopt, std::nullopt});
  auto error = errors_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->stringDetail("busError"), busErrorName::limitsExceeded);
  remote()->send(rowOf("WakeUp"), {}, toReplies());
  auto next = object_->requests.take();
  ASSERT_TRUE(next);
  next->reply({});
  EXPECT_TRUE(replies_.take());
}

TEST_P(ConnectionTest, CallThatIsTooLargeFailsAndTheConnectionLives) {
  exportDaemon(object_);
  const auto remoteObject = remote();
  remoteObject->send(rowOf("StartProvidingItemAtURL"), {{}, Value(std::string(maximumStringSize + 1, 'x')), {}},
                     toReplies());
  auto error = errors_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->stringDetail("busError"), busErrorName::limitsExceeded);
  remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  auto next = object_->requests.take();
  ASSERT_TRUE(next);
  next->reply({});
  EXPECT_TRUE(replies_.take());
}

TEST_P(ConnectionTest, RepliesWaitForAPeerThatDoesNotRead) {
  // Far more than a socket holds, so that most of it has to be written later.
  const Data large{std::string(900'000, 'x')};
  exportDaemon(std::make_shared<AnsweringObject>(Arguments{std::nullopt, Value(large), std::nullopt, std::nullopt}));
  PlainClient plain(std::move(peerSocket_));
  EXPECT_TRUE(plain.call(plain.message(daemonPath, daemonInterface, "WakeUp")) == nullptr) << "wrong number of values";
  constexpr int count = 30;
  int answered = 0;
  for (int i = 0; i < count; ++i) {
    const OwnedMessage request = plain.message(daemonPath, daemonInterface, "ExtendSandboxForFileURL");
    ASSERT_GE(sd_bus_message_append(request.get(), "asasas", 0, 0, 0), 0);
    const auto countAnswer = [](sd_bus_message *, void *counter, sd_bus_error *) {
      ++*static_cast<int *>(counter);
      return 0;
    };
    ASSERT_GE(sd_bus_call_async(plain.bus(), nullptr, request.get(), countAnswer, &answered, 60'000'000), 0);
  }
  while (answered < count) {
    const int result = sd_bus_process(plain.bus(), nullptr);
    ASSERT_GE(result, 0);
    if (result == 0) {
      ASSERT_GE(sd_bus_wait(plain.bus(), 60'000'000), 0);
    }
  }
}

TEST_P(ConnectionTest, TheRequestAfterTheLimitWaitsUntilOneIsAnswered) {
  constexpr std::size_t limit = 256;
  exportDaemon(object_);
  const auto remoteObject = remote();
  for (std::size_t i = 0; i <= limit; ++i) remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  std::vector<RecordingObject::Request> requests;
  requests.reserve(limit);
  for (std::size_t i = 0; i < limit; ++i) requests.push_back(*object_->requests.take());
  EXPECT_EQ(object_->requests.count(), 0U);
  EXPECT_FALSE((*server_)->wanted().events & POLLIN) << "nothing more is read";
  requests.front().reply({});
  auto last = object_->requests.take();
  ASSERT_TRUE(last);
  EXPECT_TRUE(replies_.take());
}

TEST_P(ConnectionTest, RequestsLeftUnansweredDoNotCountOnceTheyAreLetGo) {
  constexpr std::size_t limit = 256;
  exportDaemon(object_);
  const auto remoteObject = remote();
  for (std::size_t i = 0; i <= limit; ++i) remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  for (std::size_t i = 0; i <= limit; ++i) EXPECT_TRUE(object_->requests.take());
  EXPECT_EQ(replies_.count(), 0U);
}

TEST_P(ConnectionTest, PeerThatGoesWithTooManyRequestsInFlightIsNoticed) {
  constexpr std::size_t limit = 256;
  exportDaemon(object_);
  const auto remoteObject = remote();
  for (std::size_t i = 0; i < limit; ++i) remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  std::vector<RecordingObject::Request> requests;
  requests.reserve(limit);
  for (std::size_t i = 0; i < limit; ++i) requests.push_back(*object_->requests.take());
  client()->close();
  EXPECT_TRUE(closed_.take());
}

TEST_P(ConnectionTest, TheObjectIsLetGoOfWhenTheConnectionEndsThoughARequestIsUnanswered) {
  const std::weak_ptr<RecordingObject> weak = object_;
  exportDaemon(object_);
  remote()->send(rowOf("WakeUp"), {}, toReplies());
  const auto request = object_->requests.take();
  object_.reset();
  client()->close();
  EXPECT_TRUE(closed_.take());
  server_->join();
  EXPECT_TRUE(weak.expired());
  ASSERT_TRUE(request);
  request->reply({});
}

TEST_P(ConnectionTest, ObjectThatOwnsTheRepliesToItselfIsLetGoOfToo) {
  const std::weak_ptr<RecordingObject> weak = object_;
  exportDaemon(object_);
  const auto remoteObject = remote();
  remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  remoteObject->send(rowOf("WakeUp"), {}, toReplies());
  EXPECT_TRUE(object_->requests.take());
  object_.reset();
  client()->close();
  EXPECT_TRUE(closed_.take());
  server_->join();
  EXPECT_TRUE(weak.expired());
}

// --- What bad input gets

TEST_P(ConnectionTest, RequestThatWasThereBeforeTheConnectionIsServed) {
  auto [ours, theirs] = makeSocketPair();
  std::optional<PlainClient> plain(std::move(theirs));
  BusConnection::Options options;
  options.side = BusConnection::Side::server;
  TestConnection late(pool_, std::move(ours), std::move(options));
  late->exportObject(LinkInterface(daemonProtocol()), std::make_shared<AnsweringObject>(Arguments{}));
  late.start();
  EXPECT_NE(plain->call(plain->message(daemonPath, daemonInterface, "WakeUp")), nullptr) << plain->errorText;
}

class HandMethodsTest : public BusConnectionTest {
 protected:
  void exportSandbox(BusConnection::MethodHandler consume, BusConnection::MethodHandler prove) {
    (*server_)->exportMethods(sandboxInterface(), {std::move(consume), std::move(prove)});
    server_->start();
  }
};

TEST_F(HandMethodsTest, DescriptorsTravelBothWays) {
  exportSandbox(
      [](MethodValues values, const BusConnection::Reply &reply) {
        EXPECT_EQ(std::get<Data>(values[0]).bytes, "token");
        MethodValues answer;
        answer.emplace_back(UniqueFd(open("/dev/null", O_RDWR | O_CLOEXEC)));
        reply.send(std::move(answer));
      },
      [](MethodValues values, const BusConnection::Reply &reply) {
        const int fd = std::get<UniqueFd>(values[0]).get();
        EXPECT_GE(fd, 3);
        EXPECT_EQ(fcntl(fd, F_GETFD), FD_CLOEXEC);
        reply.fail(platformError::noProof, "no proof");
      });
  Received<std::shared_ptr<MethodResult>> results;
  const auto handler = [&results](MethodResult result) {
    results.put(std::make_shared<MethodResult>(std::move(result)));
  };
  MethodValues token;
  token.emplace_back(Data{"token"});
  client()->call(sandboxInterface(), consumeMethod, std::move(token), handler);
  auto consumed = results.take();
  ASSERT_TRUE(consumed);
  auto *values = std::get_if<MethodValues>(consumed->get());
  ASSERT_TRUE(values);
  const UniqueFd &passed = std::get<UniqueFd>(values->front());
  EXPECT_EQ(fcntl(passed.get(), F_GETFD), FD_CLOEXEC);

  MethodValues proof;
  proof.emplace_back(UniqueFd(open("/dev/null", O_RDWR | O_CLOEXEC)));
  client()->call(sandboxInterface(), proveWriteAccessMethod, std::move(proof), handler);
  auto refused = results.take();
  ASSERT_TRUE(refused);
  const auto *failure = std::get_if<MethodFailure>(refused->get());
  ASSERT_TRUE(failure);
  EXPECT_EQ(failure->name, platformError::noProof);
  EXPECT_EQ(failure->text, "no proof");
}

TEST_F(HandMethodsTest, ConnectionThatEndsIsTheFailureDisconnected) {
  Received<BusConnection::Reply> requests;
  exportSandbox([&requests](MethodValues, BusConnection::Reply reply) { requests.put(std::move(reply)); },
                [](MethodValues, const BusConnection::Reply &) {});
  Received<std::string> failures;
  MethodValues token;
  token.emplace_back(Data{"token"});
  client()->call(sandboxInterface(), consumeMethod, std::move(token),
                 [&failures](const MethodResult &result) { failures.put(std::get<MethodFailure>(result).name); });
  const auto reply = requests.take();
  (*server_)->close();
  EXPECT_EQ(failures.take(), busErrorName::disconnected);
}

TEST_F(HandMethodsTest, GreetingPingAndIntrospectionAreAnswered) {
  exportDaemon(object_);
  PlainClient plain(std::move(peerSocket_));
  const OwnedMessage hello = plain.call(plain.message("/org/freedesktop/DBus", "org.freedesktop.DBus", "Hello"));
  ASSERT_NE(hello, nullptr) << plain.errorText;
  const char *name = nullptr;
  ASSERT_GT(sd_bus_message_read(hello.get(), "s", &name), 0);
  EXPECT_TRUE(std::string_view(name).starts_with(":1."));
  EXPECT_NE(plain.call(plain.message(daemonPath, "org.freedesktop.DBus.Peer", "Ping")), nullptr);

  const auto introspect = [&plain](const char *path) {
    const OwnedMessage reply = plain.call(plain.message(path, "org.freedesktop.DBus.Introspectable", "Introspect"));
    const char *xml = nullptr;
    if (reply) {
      EXPECT_GT(sd_bus_message_read(reply.get(), "s", &xml), 0);
    }
    return std::string(xml ? xml : "");
  };
  EXPECT_THAT(introspect("/"), HasSubstr("<node name=\"com\"/>"));
  EXPECT_THAT(introspect("/com"), HasSubstr("<node name=\"tessel\"/>"));
  EXPECT_THAT(introspect(daemonPath), HasSubstr("<interface name=\"com.tessel.Storix.Daemon\">"));
  EXPECT_EQ(introspect("/com/other"), "");
  EXPECT_EQ(plain.errorName, "org.freedesktop.DBus.Error.UnknownObject");
}

TEST(BusConnectionStart, SocketOfAPeerThatIsGoneEndsNothingElse) {
  auto [ours, theirs] = makeSocketPair();
  theirs.reset();
  BusConnection::Options options;
  options.side = BusConnection::Side::server;
  const int fd = ours.get();
  auto opened = BusConnection::open(std::move(ours), std::move(options));
  if (opened) {
    opened.value()->process();
    EXPECT_FALSE(opened.value()->isOpen());
    opened.value()->releaseSocket();
  }
  EXPECT_EQ(fcntl(fd, F_GETFD), -1) << "the descriptor is closed";
}

}  // namespace
}  // namespace storix::wire
