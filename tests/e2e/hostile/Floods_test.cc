// Attacks by mere number: requests, connections, answers that nobody reads.

#include <sys/resource.h>
#include <sys/socket.h>

#include <poll.h>
#include <cerrno>

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

/// So often nothing more is taken, while the bystander is served each time, before the daemon counts as
/// having stopped to read.
constexpr int roundsWithoutProgress = 2000;

/// The limit of a connection, and those that wait in one direction of the socket or whose answers do in the
/// other. sd-bus has the system keep up to 16 MiB of these, each of which takes no less than 512 bytes there;
/// the other direction holds 212,992 bytes of messages of no less than 32.
constexpr std::size_t mostTaken = 256 + (std::size_t{16} << 20) / 512 + 212992 / 32;

class HostileFloods : public HostileTest {
 protected:
  /// Sends the message with rising serials and reads no answer, until the daemon takes no more of them,
  /// and serves the bystander all the while. Gives how many were sent, those that wait in the socket among
  /// them.
  std::size_t floodUntilNothingIsTaken(const RawClient &client, Message message, std::size_t atMost) {
    std::string pending;
    std::uint32_t serial = 0;
    std::size_t sent = 0;
    int idle = 0;
    const std::size_t size = message.bytes().size();
    while (idle < roundsWithoutProgress && serial < atMost) {
      if (pending.size() < 65536) {
        for (int i = 0; i < 64; ++i) pending += message.numbered(++serial).bytes();
      }
      const std::size_t count = client.offer(pending);
      pending.erase(0, count);
      sent += count;
      idle = count == 0 ? idle + 1 : 0;
      if (count == 0) {
        serveBystander();
        if (HasFatalFailure()) return 0;
      }
    }
    return sent / size;
  }
};

TEST_F(HostileFloods, RequestsOfAClientThatNeverReadsAreNotTakenForEver) {
  startWithBystander();
  {
    const RawClient client = serviceClient();
    const std::size_t taken = floodUntilNothingIsTaken(client, Message::service("WakeUp"), 500000);
    EXPECT_LT(taken, mostTaken);
  }
  expectHealthy();
}

TEST_F(HostileFloods, LargeAnswersThatNobodyReadsAreNotMadeForEver) {
  startWithBystander();
  {
    const RawClient client = serviceClient();
    const Message introspection =
        Message::call(Message::servicePath, "org.freedesktop.DBus.Introspectable", "Introspect");
    EXPECT_LT(floodUntilNothingIsTaken(client, introspection, 500000), mostTaken);
  }
  expectHealthy();
}

TEST_F(HostileFloods, ErrorsThatNobodyReadsAreNotMadeForEver) {
  startWithBystander();
  {
    const RawClient client = serviceClient();
    EXPECT_LT(floodUntilNothingIsTaken(client, Message::service("Fly"), 500000), mostTaken);
  }
  expectHealthy();
}

TEST_F(HostileFloods, SlowReaderGetsEveryAnswerInOrderOnceItReads) {
  startWithBystander();
  {
    RawClient client = serviceClient();
    constexpr std::uint32_t requests = 3000;
    std::string pending;
    for (std::uint32_t serial = 1; serial <= requests; ++serial) {
      pending += Message::call(Message::servicePath, "org.freedesktop.DBus.Introspectable", "Introspect")
                     .numbered(serial)
                     .bytes();
    }
    for (std::uint32_t serial = 1; serial <= requests; ++serial) {
      pending.erase(0, client.offer(pending));
      const std::optional<RawAnswer> answer = client.read();
      ASSERT_TRUE(answer) << serial;
      ASSERT_EQ(serial, answer->replyTo);
      if (serial % 100 != 0) continue;
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
    EXPECT_TRUE(pending.empty());
  }
  expectHealthy();
}

TEST_F(HostileFloods, TwoHundredFiftySixRequestsAreInFlightAndTheNextIsNotRead) {
  session.installProvider("org.sample.silent", "start never");
  startWithBystander();
  ASSERT_TRUE(bystander->extendSandbox(itemURL("org.sample.silent", "a"), "org.sample.silent", "c"));
  const Message start =
      Message::service("StartProvidingItemAtURL", "asasas",
                       itemArguments(itemURL("org.sample.silent", "a").absoluteString(), "org.sample.silent", "c"));
  {
    const RawClient client = serviceClient();
    std::string pending;
    Message next = start;
    for (std::uint32_t serial = 1; serial <= 256; ++serial) pending += next.numbered(serial).bytes();
    ASSERT_TRUE(client.send(pending));
    // The bystander's requests are answered though all of them hang.
    const auto served = [this] { return daemon->countLines("Serving: startProvidingItemAtURL:"); };
    const std::size_t before = served();
    const auto end = std::chrono::steady_clock::now() + deadline;
    std::size_t last = before;
    while ((last = served()) < 256 && std::chrono::steady_clock::now() < end) {
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
    const RawClient another = serviceClient();
    // The two that the bystander made before are among the lines.
    ASSERT_TRUE(client.send(next.numbered(257)) && client.send(next.numbered(258)));
    for (int i = 0; i < 50; ++i) ASSERT_NO_FATAL_FAILURE(serveBystander());
    EXPECT_EQ(256U + 2U, served());
  }
  expectHealthy();
}

TEST_F(HostileFloods, RequestsThatWantNoAnswerKeepNobodyWaiting) {
  startWithBystander();
  {
    const RawClient client = serviceClient();
    Message quiet = Message::service("WakeUp");
    quiet.flags = Message::noReplyExpected;
    std::string pending;
    for (std::uint32_t serial = 1; serial <= 1000; ++serial) pending += quiet.numbered(serial).bytes();
    // Every further thousand comes while the bystander waits for its one answer.
    for (int round = 0; round < 20; ++round) {
      ASSERT_TRUE(client.send(pending));
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
  }
  expectHealthy();
}

/// Requests without a reply to a provider that hangs: nothing but the limits of what waits for it holds them
/// up.
class FloodOfAProviderThatHangs : public HostileFloods {
 protected:
  void startWithHostile() {
    // The rest would tell of every request.
    session.environment["STORIX_LOG"] = "info";
    installHostile("deaf");
    startWithBystander();
    ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.hostile"));
    ASSERT_TRUE(bystander->extendSandbox(itemURL(hostile, "item"), hostile, "c"));
    descriptors = descriptorsInUse();
  }

  /// From now on it reads nothing more. One message waits for its answer.
  void deafen(const RawClient &client) const {
    ASSERT_TRUE(client.send(Message::service("StartProvidingItemAtURL", "asasas",
                                             itemArguments(itemURL(hostile, "item").absoluteString(), hostile, "c"))));
    ASSERT_TRUE(daemon->waitForLine("Extension org.sample.hostile: deaf"));
  }

  /// Sends requests without a reply for an item whose name is that long, each of which asks the provider.
  void flood(const RawClient &client, std::size_t nameLength, std::size_t count) {
    Message request =
        Message::service("ProvidePlaceholderForItemAtURL", "asasas",
                         itemArguments(itemURL(hostile, std::string(nameLength, 'x')).absoluteString(), hostile, "c"));
    request.flags = Message::noReplyExpected;
    for (std::uint32_t serial = 2; serial < count + 2; ++serial) {
      ASSERT_TRUE(client.send(request.numbered(serial)));
      if (serial % 100 != 0) continue;
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
  }

  /// So many of them failed, for the reason that stands in the lines. The bystander is served until then.
  void expectFailed(std::size_t count, const std::string &reason) {
    const auto failed = [this, &reason] {
      std::size_t lines = 0;
      for (const std::string &line : daemon->errorLines()) {
        if (line.starts_with("[ERROR] Extension request failed.") || line.starts_with("[ERROR] Error getting remote")) {
          lines += line.find(reason) != std::string::npos ? 1 : 0;
        }
      }
      return lines;
    };
    const auto end = std::chrono::steady_clock::now() + deadline;
    while (failed() < count && std::chrono::steady_clock::now() < end) ASSERT_NO_FATAL_FAILURE(serveBystander());
    // Whatever came after them on another connection is answered later.
    for (int i = 0; i < 50; ++i) ASSERT_NO_FATAL_FAILURE(serveBystander());
    EXPECT_EQ(count, failed());
  }
};

TEST_F(FloodOfAProviderThatHangs, FourThousandNinetySixMessagesWaitAndTheNextFails) {
  startWithHostile();
  {
    const RawClient client = serviceClient();
    ASSERT_NO_FATAL_FAILURE(deafen(client));
    ASSERT_NO_FATAL_FAILURE(flood(client, 10, 4095 + 60));
    ASSERT_NO_FATAL_FAILURE(expectFailed(60, "has not answered 4096 messages yet"));
  }
  ASSERT_NO_FATAL_FAILURE(killHostile());
  expectHealthy();
}

TEST_F(FloodOfAProviderThatHangs, LongMessagesTakeThePlacesOfSeveralAndTheirMemoryComesBack) {
  startWithHostile();
  {
    constexpr std::size_t length = 60000;
    const std::size_t places = 1 + itemURL(hostile, std::string(length, 'x')).absoluteString().size() / 4096;
    constexpr std::size_t count = 1500;
    const RawClient client = serviceClient();
    ASSERT_NO_FATAL_FAILURE(deafen(client));
    ASSERT_NO_FATAL_FAILURE(flood(client, length, count));
    ASSERT_NO_FATAL_FAILURE(expectFailed(count - 4095 / places, "has not answered 4096 messages yet"));
    // Of each text there are three copies at most.
    EXPECT_LT(memoryInUse(), memory + 3 * 4096 * std::size_t{4096} + memoryThatMayStay);
  }
  ASSERT_NO_FATAL_FAILURE(killHostile());
  expectHealthy();
}

TEST_F(FloodOfAProviderThatHangs, ThousandAndTwentyFourRequestsWaitForItsStartAndTheNextFails) {
  startWithHostile();
  ASSERT_NO_FATAL_FAILURE(killHostile());
  instructHostile("endless-login");
  {
    const RawClient client = serviceClient();
    ASSERT_NO_FATAL_FAILURE(flood(client, 25000, 1024 + 60));
    ASSERT_NO_FATAL_FAILURE(expectFailed(60, "1024 requests wait already until the process of the extension"));
    // A sandbox that is killed in the making leaves something behind.
    ASSERT_TRUE(daemon->waitForLine("Extension org.sample.hostile: no login"));
  }
  ASSERT_NO_FATAL_FAILURE(killHostile());
  expectHealthy();
}

TEST_F(HostileFloods, ClientsGoneBeforeTheirAnswersAreForgotten) {
  session.installProvider("org.sample.silent", "start never");
  startWithBystander();
  ASSERT_TRUE(bystander->extendSandbox(itemURL("org.sample.silent", "a"), "org.sample.silent", "c"));
  descriptors = descriptorsInUse();
  for (int i = 0; i < 200; ++i) {
    const RawClient client = serviceClient();
    ASSERT_TRUE(client.send(
        Message::service("StartProvidingItemAtURL", "asasas",
                         itemArguments(itemURL("org.sample.silent", "a").absoluteString(), "org.sample.silent", "c"))));
  }
  expectHealthy();
}

TEST_F(HostileFloods, ThousandAndMoreConnectionsLeaveWhatTheDaemonNeedsForItselfAndTheLaterOnesWait) {
  rlimit limit{};
  ASSERT_EQ(0, ::getrlimit(RLIMIT_NOFILE, &limit));
  limit.rlim_cur = std::min<rlim_t>(limit.rlim_max, 4096);
  ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &limit));
  startWithBystander();
  {
    constexpr std::size_t most = 1024;
    constexpr std::size_t attempts = 1100;
    std::vector<std::unique_ptr<RawClient>> clients;
    for (std::size_t i = 0; i < attempts; ++i) {
      clients.push_back(std::make_unique<RawClient>(session.serviceSocket(), RawClient::Login::none));
      ASSERT_TRUE(clients.back()->send(std::string(loginBytes()) + Message::service("WakeUp").bytes()));
    }
    // One place is the bystander's own. Whoever has one is answered.
    const auto answered = [&clients] {
      std::size_t count = 0;
      for (const auto &client : clients) {
        pollfd waited{client->fd(), POLLIN, 0};
        count += ::poll(&waited, 1, 0) == 1 ? 1 : 0;
      }
      return count;
    };
    const auto end = std::chrono::steady_clock::now() + deadline;
    while (answered() < most - 1 && std::chrono::steady_clock::now() < end) {
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
    for (int i = 0; i < 50; ++i) ASSERT_NO_FATAL_FAILURE(serveBystander());
    EXPECT_EQ(most - 1, answered());
    // A grant is written to the disk, and a provider that is new is found, started and asked.
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, docs, "written-meanwhile"));
    EXPECT_NE(std::string::npos, Session::read(session.accessControlFile()).find("written-meanwhile"));
    session.installProvider("org.sample.new");
    ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.new"));
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, "org.sample.new", "report"));
    // A place that comes free is the next one's.
    clients.erase(clients.begin());
    while (answered() < most - 1 && std::chrono::steady_clock::now() < end + deadline) {
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
    EXPECT_EQ(most - 1, answered());
    // The new provider's process stays for a while.
    descriptors = descriptors + 8;
  }
  expectHealthy();
}

TEST_F(HostileFloods, DescriptorsOnMessagesThatNeverEndLeaveWhatTheDaemonNeedsForItself) {
  startWithBystander();
  {
    std::vector<std::unique_ptr<RawClient>> clients;
    // A message that never comes to its end, each byte with as many descriptors as one may have: more than
    // the daemon may have open.
    Message endless = Message::platform("Sandbox", "ProveWriteAccess", "h", Body().number(0));
    endless.bodyLength = 65536;
    const std::string bytes = endless.bytes();
    for (int i = 0; i < 4; ++i) {
      clients.push_back(std::make_unique<RawClient>(session.platformSocket()));
      ASSERT_EQ("", clients.back()->call(Message::call("/", "org.freedesktop.DBus.Peer", "Ping")));
      for (const char byte : bytes) {
        if (!clients.back()->sendWithDescriptors(std::string(1, byte), clients.back()->fd(), 250)) break;
      }
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, docs, "written-meanwhile"));
    ASSERT_NO_FATAL_FAILURE(serveNewClient());
  }
  expectHealthy();
}

}  // namespace
}  // namespace storix::e2e
