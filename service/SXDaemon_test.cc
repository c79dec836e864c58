#include "service/SXDaemon.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace storix {
namespace {

/// The other end: keeps what it is sent, and answers what it was told to.
class RecordingRemote : public RemoteObject {
 public:
  void send(std::size_t operation, Arguments arguments, ReplyHandler reply) override {
    sent.emplace_back(operation, std::move(arguments));
    if (reply) reply(answer);
  }

  std::vector<std::pair<std::size_t, Arguments>> sent;
  Arguments answer;
};

/// A value of that kind, another one for each position.
Argument sample(ValueKind kind, std::size_t position) {
  const std::string text = "value " + std::to_string(position);
  switch (kind) {
    case ValueKind::URL:
      return URL::fromString("file:///tmp/" + std::to_string(position));
    case ValueKind::data:
      return Data{std::string(position + 1, 'x')};
    case ValueKind::error:
      return SXError("org.sample.errors", static_cast<std::int64_t>(position));
    case ValueKind::dictionary:
      return Dictionary{{text, text}};
    default:
      return text;
  }
}

Arguments samples(const std::vector<ArgumentDescription> &descriptions) {
  Arguments values;
  for (std::size_t i = 0; i < descriptions.size(); ++i) values.push_back(sample(descriptions[i].kind, i));
  return values;
}

TEST(SXDaemonProxy, SendsEveryOperationAsItIsAndHandsBackItsAnswer) {
  const auto remote = std::make_shared<RecordingRemote>();
  ProtocolExporter<SXDaemon> exporter(SXDaemonProtocol(), std::make_shared<SXDaemonProxy>(remote));
  const std::vector<OperationDescription> &operations = SXDaemonProtocol().description().operations;
  for (std::size_t i = 0; i < operations.size(); ++i) {
    const Arguments given = samples(operations[i].arguments);
    remote->answer = samples(operations[i].replies);
    remote->sent.clear();
    std::vector<Arguments> answers;
    exporter.invoke(i, given, [&answers](Arguments answer) { answers.push_back(std::move(answer)); });
    EXPECT_EQ(remote->sent, (std::vector<std::pair<std::size_t, Arguments>>{{i, given}})) << operations[i].name;
    EXPECT_EQ(answers, std::vector<Arguments>{remote->answer}) << operations[i].name;
  }
}

}  // namespace
}  // namespace storix
