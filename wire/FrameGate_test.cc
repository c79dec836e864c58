#include "wire/FrameGate.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstring>

#include "wire/DescriptorCall.h"
#include "wire/SendBytes.h"
#include "wire/TestConnection.h"

namespace storix::wire {
namespace {

using Verdict = Framing::Verdict;

/// A message, its numbers in either byte order. Fields are a code, a type and a text or a number.
class Bytes {
 public:
  explicit Bytes(bool littleEndian = true) : littleEndian_(littleEndian) {}

  Bytes &number(std::size_t value) {
    for (unsigned i = 0; i < 4; ++i) bytes_ += static_cast<char>(value >> 8 * (littleEndian_ ? i : 3 - i) & 0xff);
    return *this;
  }
  Bytes &text(char code, char type, const std::string &value) {
    pad().raw({code, 1, type, '\0'});
    if (type == 'g') {
      bytes_ += static_cast<char>(value.size());
    } else {
      number(value.size());
    }
    return raw(value).raw({'\0'});
  }
  Bytes &count(char code, std::size_t value) { return pad().raw({code, 1, 'u', '\0'}).number(value); }
  Bytes &raw(const std::string &value) {
    bytes_ += value;
    return *this;
  }
  Bytes &pad() {
    bytes_.resize((bytes_.size() + 7) / 8 * 8);
    return *this;
  }

  [[nodiscard]] std::string message(std::size_t serial, const std::string &body = {}, char type = 1,
                                    char version = 1) const {
    Bytes whole(littleEndian_);
    whole.raw({littleEndian_ ? 'l' : 'B', type, '\0', version});
    return whole.number(body.size()).number(serial).number(bytes_.size()).raw(bytes_).pad().raw(body).bytes_;
  }

 private:
  const bool littleEndian_;
  std::string bytes_;
};

Bytes callFields(bool littleEndian = true) {
  return Bytes(littleEndian)
      .text(1, 'o', "/x")
      .text(2, 's', "org.sample.X")
      .text(3, 's', "Take")
      .text(8, 'g', "h")
      .count(9, 1);
}

class FrameGateTest : public testing::Test {
 protected:
  FrameGateTest() {
    std::tie(socket, peer) = makeSocketPair();
    gate = FrameGate::make(
        [](const BusTarget &target, std::string_view signature) {
          return target.path == "/x" && target.names("org.sample.X", "Take") && signature == "h";
        },
        bus);
  }

  void send(const std::string &bytes, bool withDescriptor = false) const {
    const std::array<int, 1> descriptor{peer.get()};
    ASSERT_EQ(sendBytes(peer.get(), bytes, std::span(descriptor).first(withDescriptor ? 1 : 0)),
              static_cast<ssize_t>(bytes.size()));
  }

  Verdict turn() { return gate->beforeProcess(socket.get(), false); }

  /// All that lies in the pair, and then tells the gate that it has been read.
  std::string readByBus(bool loggedIn = true, bool gotMessage = true) {
    std::string all;
    std::array<char, 65536> piece;
    alignas(cmsghdr) std::array<char, CMSG_SPACE(16 * sizeof(int))> control{};
    for (;;) {
      iovec content{piece.data(), piece.size()};
      msghdr message{};
      message.msg_iov = &content;
      message.msg_iovlen = 1;
      message.msg_control = control.data();
      message.msg_controllen = control.size();
      const ssize_t count = recvmsg(bus.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
      if (count <= 0) break;
      all.append(piece.data(), static_cast<std::size_t>(count));
      if (const cmsghdr *header = CMSG_FIRSTHDR(&message)) {
        int descriptor = -1;
        std::memcpy(&descriptor, CMSG_DATA(header), sizeof descriptor);
        received.reset(descriptor);
      }
    }
    EXPECT_EQ(gate->afterProcess(socket.get(), {loggedIn, gotMessage, !gotMessage}), Verdict::read);
    return all;
  }

  void logIn() {
    send("BEGIN\r\n");
    ASSERT_EQ(turn(), Verdict::read);
    ASSERT_EQ(readByBus(true, false), "BEGIN\r\n");
  }

  UniqueFd socket;
  UniqueFd peer;
  UniqueFd bus;
  UniqueFd received;
  std::unique_ptr<FrameGate> gate;
};

TEST_F(FrameGateTest, LoginGoesThroughLineByLine) {
  const std::string message = callFields().message(1);
  send(std::string(1, '\0') + "AUTH\r\nDATA\rx\nyz\r\nBEGIN\r\n" + message);
  for (const std::string &line : {std::string(1, '\0') + "AUTH\r\n", std::string("DATA\rx\nyz\r\n")}) {
    EXPECT_EQ(turn(), Verdict::read);
    EXPECT_EQ(readByBus(false, false), line);
  }
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(readByBus(true, false), "BEGIN\r\n");
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(readByBus(), message);
}

TEST_F(FrameGateTest, LineOfTheLoginWaitsForItsEnd) {
  for (const char *piece : {"DA", "TA", "\r"}) {
    send(piece);
    EXPECT_EQ(turn(), Verdict::read) << "sd-bus looks after the login's time";
    EXPECT_EQ(readByBus(false, false), "");
  }
  send("\n");
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(readByBus(false, false), "DATA\r\n");
}

TEST_F(FrameGateTest, LineOfTheLoginThatDoesNotEndIsRefused) {
  send(std::string(17'000, 'x'));
  Verdict verdict = Verdict::read;
  for (int i = 0; i < 100 && verdict == Verdict::read; ++i) verdict = turn();
  EXPECT_EQ(verdict, Verdict::loginTooLong);
}

TEST_F(FrameGateTest, NextLineWaitsUntilTheOneBeforeHasBeenRead) {
  send("DATA\r\nBEGIN\r\n");
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_TRUE(gate->holdsUnread());
  EXPECT_EQ(readByBus(false, false), "DATA\r\n");
  EXPECT_FALSE(gate->holdsUnread());
}

TEST_F(FrameGateTest, MessageGoesThroughWhenItIsComplete) {
  logIn();
  const std::string message = callFields().message(1, std::string(100, 'x'));
  for (const std::size_t cut :
       {std::size_t{1}, std::size_t{15}, std::size_t{16}, std::size_t{17}, message.size() - 1}) {
    EXPECT_TRUE(gate->atBoundary());
    send(message.substr(0, cut));
    EXPECT_EQ(turn(), Verdict::nothing);
    EXPECT_FALSE(gate->atBoundary());
    EXPECT_EQ(readByBus(true, false), "");
    send(message.substr(cut));
    EXPECT_EQ(turn(), Verdict::read);
    EXPECT_EQ(readByBus(), message);
  }
}

TEST_F(FrameGateTest, MessagesGoThroughOneByOne) {
  logIn();
  const std::string first = callFields().message(1, "first");
  const std::string second = callFields(false).message(2, "second");
  send(first + second);
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(readByBus(), first);
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(readByBus(), second);
  EXPECT_EQ(turn(), Verdict::nothing);
}

TEST_F(FrameGateTest, LargestMessageGoesThroughAsItIsRead) {
  logIn();
  const std::string empty = callFields().message(1);
  const std::string message = callFields().message(1, std::string(maximumMessageSize - empty.size(), 'x'));
  std::size_t sent = 0;
  std::string got;
  while (got.size() < message.size()) {
    const ssize_t count = ::send(peer.get(), message.data() + sent, message.size() - sent, MSG_DONTWAIT);
    if (count > 0) sent += static_cast<std::size_t>(count);
    ASSERT_TRUE(turn() == Verdict::read || sent < message.size());
    got += readByBus(true, got.size() == message.size());
  }
  EXPECT_EQ(got, message);
}

TEST_F(FrameGateTest, MessageBeyondTheLimitIsRefusedByItsHeaderAlone) {
  logIn();
  const std::string empty = callFields().message(1);
  const std::string message = callFields().message(1, std::string(maximumMessageSize - empty.size() + 1, 'x'));
  send(message.substr(0, FixedHeader::size));
  EXPECT_EQ(turn(), Verdict::tooLarge);
}

TEST_F(FrameGateTest, OtherVersionsAreRefused) {
  logIn();
  send(callFields().message(1, {}, 1, 2));
  EXPECT_EQ(turn(), Verdict::otherVersion);
}

TEST_F(FrameGateTest, WhatIsNoMessageIsRefused) {
  logIn();
  send("this is no message, see");
  EXPECT_EQ(turn(), Verdict::noMessage);
}

TEST_F(FrameGateTest, EndOfThePeerIsSeen) {
  logIn();
  peer.reset();
  EXPECT_EQ(turn(), Verdict::ended);
}

TEST_F(FrameGateTest, DescriptorGoesThroughWithItsCall) {
  logIn();
  const std::string message = callFields().message(1, std::string(4, '\0'));
  send(message.substr(0, 40), true);
  EXPECT_EQ(turn(), Verdict::nothing);
  send(message.substr(40));
  EXPECT_EQ(turn(), Verdict::read);
  EXPECT_EQ(readByBus(), message);
  EXPECT_TRUE(received);
  // The copies here and there are closed: the peer's end is held by the peer and the receiver alone.
  received.reset();
  peer.reset();
  EXPECT_EQ(turn(), Verdict::ended);
}

TEST_F(FrameGateTest, SecondDescriptorIsRefused) {
  logIn();
  const std::string message = callFields().message(1, std::string(4, '\0'));
  send(message.substr(0, 40), true);
  EXPECT_EQ(turn(), Verdict::nothing);
  send(message.substr(40), true);
  EXPECT_EQ(turn(), Verdict::unwantedDescriptor);
}

TEST_F(FrameGateTest, DescriptorDuringTheLoginIsRefused) {
  send("BEGIN\r\n", true);
  EXPECT_EQ(turn(), Verdict::unwantedDescriptor);
}

TEST_F(FrameGateTest, DescriptorOfAnotherCallIsRefused) {
  logIn();
  send(Bytes().text(1, 'o', "/x").text(3, 's', "Other").text(8, 'g', "h").count(9, 1).message(1), true);
  EXPECT_EQ(turn(), Verdict::unwantedDescriptor);
}

// --- How a call with a descriptor is written anew

std::string rewritten(const std::string &message) {
  const auto all = [](const BusTarget &, std::string_view) { return true; };
  return rewrittenDescriptorCall(message, all).value_or("refused");
}

TEST(DescriptorCall, OnlyWhatItNeedsGoesOver) {
  for (const bool littleEndian : {true, false}) {
    const std::string sound = callFields(littleEndian).message(7, "body");
    EXPECT_EQ(rewritten(sound), sound);
    const Bytes more = callFields(littleEndian).text(6, 's', "not a name").text(7, 's', "").text(90, 'g', "later");
    EXPECT_EQ(rewritten(more.message(7, "body")), sound);
  }
}

TEST(DescriptorCall, InterfaceMayBeLeftOpen) {
  const std::string sound = Bytes().text(1, 'o', "/x").text(3, 's', "Take").text(8, 'g', "h").count(9, 1).message(7);
  EXPECT_EQ(rewritten(sound), sound);
}

TEST(DescriptorCall, WhatIsNoSoundCallIsRefused) {
  EXPECT_EQ(rewritten(callFields().message(0)), "refused") << "a number is missing";
  EXPECT_EQ(rewritten(callFields().message(1, {}, 2)), "refused") << "an answer";
  EXPECT_EQ(rewritten(Bytes().text(1, 'o', "/x").message(1)), "refused") << "no descriptor is counted";
  EXPECT_EQ(rewritten(callFields().count(9, 2).message(1)), "refused") << "two are";
  EXPECT_EQ(rewritten(callFields().count(4, 1).message(1)), "refused") << "a number of something else";
  EXPECT_EQ(rewritten(callFields().text(9, 's', "1").message(1)), rewritten(callFields().message(1)))
      << "a text is no count";
  EXPECT_EQ(rewritten(callFields().text(6, 'v', "x").message(1)), "refused") << "a type that no field has";
  EXPECT_EQ(rewritten(callFields().pad().raw({6, 2, 's', 's', '\0'}).message(1)), "refused") << "two values";
}

TEST(DescriptorCall, FieldsThatAreCutOffAreRefused) {
  const std::string sound = callFields().message(1);
  for (std::size_t size = 0; size < sound.size() - FixedHeader::size; ++size) {
    std::string cut = sound.substr(0, FixedHeader::size + (size + 7) / 8 * 8);
    cut[12] = static_cast<char>(size);
    if (rewritten(cut) != "refused") ADD_FAILURE() << size;
  }
}

}  // namespace
}  // namespace storix::wire
