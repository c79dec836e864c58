#pragma once

#include "wire/BusConnection.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cerrno>
#include <ostream>
#include <string>
#include <thread>
#include <vector>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"
#include "providers/_KTStorixVendor.h"
#include "service/SXDaemon.h"
#include "wire/Codec.h"
#include "wire/PlatformInterfaces.h"
#include "wire/TestConnection.h"

namespace storix::wire {

inline constexpr const char *daemonPath = "/com/tessel/Storix";
inline constexpr const char *daemonInterface = "com.tessel.Storix.Daemon";

/// Gives every request to the test, which answers when it likes.
class RecordingObject : public ExportedObject {
 public:
  struct Request {
    std::size_t operation;
    Arguments arguments;
    ReplyHandler reply;
  };
  void invoke(std::size_t operation, Arguments arguments, ReplyHandler reply) override {
    requests.put({operation, std::move(arguments), std::move(reply)});
  }
  Received<Request> requests;
};

/// Answers each request at once with the same values.
class AnsweringObject : public ExportedObject {
 public:
  explicit AnsweringObject(Arguments answer) : answer_(std::move(answer)) {}
  void invoke(std::size_t, Arguments, ReplyHandler reply) override {
    if (reply) reply(answer_);
  }

 private:
  Arguments answer_;
};

inline const ProtocolDescription &daemonProtocol() { return SXDaemonProtocol().description(); }
inline std::size_t rowOf(std::string_view method) {
  return static_cast<std::size_t>(daemonProtocol().operationNamed(method) - daemonProtocol().operations.data());
}

class BusConnectionTest : public testing::Test {
 protected:
  using Descriptors = BusConnection::Descriptors;

  explicit BusConnectionTest(Descriptors descriptors = Descriptors::passed) {
    auto [ours, theirs] = makeSocketPair();
    peerSocket_ = std::move(theirs);
    BusConnection::Options options;
    options.side = BusConnection::Side::server;
    options.descriptors = descriptors;
    options.peer = "pid 42";
    server_.emplace(pool_, std::move(ours), std::move(options));
    (*server_)->setClosedHandler([this](const SXError &error) { closed_.put(error); });
  }

  void exportDaemon(std::shared_ptr<ExportedObject> object) {
    LinkInterface interface(daemonProtocol());
    interface.setPermittedKinds({ValueKind::dictionary, ValueKind::string, ValueKind::URL}, SXDaemon::providersName, 1,
                                true);
    (*server_)->exportObject(interface, std::move(object));
    server_->start();
  }

  /// The other end, driven like the SDK drives it.
  TestConnection &client() {
    if (!client_) {
      BusConnection::Options options;
      options.descriptors = BusConnection::Descriptors::passed;
      options.peer = "the daemon";
      client_.emplace(pool_, std::move(peerSocket_), std::move(options));
      client_->start();
    }
    return *client_;
  }

  std::shared_ptr<RemoteObject> remote() {
    return client()->remoteObject(LinkInterface(daemonProtocol()), [this](SXError error) { errors_.put(error); });
  }
  ReplyHandler toReplies() {
    return [this](Arguments values) { replies_.put(std::move(values)); };
  }

  std::vector<std::string> logTexts() { return platform_->log().texts(); }

  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
  ProcessScope scope_{*platform_};
  UniqueFd peerSocket_;
  Received<SXError> closed_;
  Received<SXError> errors_;
  Received<Arguments> replies_;
  std::shared_ptr<RecordingObject> object_ = std::make_shared<RecordingObject>();
  ThreadPool pool_;
  std::optional<TestConnection> server_;
  std::optional<TestConnection> client_;
};

/// Names a test's parameter.
inline void PrintTo(const BusConnection::Descriptors &descriptors, std::ostream *out) {
  *out << (descriptors == BusConnection::Descriptors::passed ? "WithDescriptors" : "WithoutDescriptors");
}

/// Run with each way in which what the peer sends is cut into messages.
class EachFramingTest : public BusConnectionTest, public testing::WithParamInterface<BusConnection::Descriptors> {
 public:
  static auto each() { return testing::Values(Descriptors::refused, Descriptors::passed); }
  static std::string name(const testing::TestParamInfo<Descriptors> &tested) {
    return testing::PrintToString(tested.param);
  }

 protected:
  EachFramingTest() : BusConnectionTest(GetParam()) {}
};

}  // namespace storix::wire
