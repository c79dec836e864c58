#include "platform/ProtocolTable.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace storix {
namespace {

class Sample {
 public:
  virtual ~Sample() = default;
  virtual void ping(CompletionHandler<> completion) = 0;
  virtual void find(std::optional<URL> url, std::optional<std::string> name,
                    CompletionHandler<SXError, Dictionary> completion) = 0;
  virtual void store(std::optional<Data> data, CompletionHandler<Data> completion) = 0;
};

const ProtocolTable<Sample> &sampleProtocol() {
  static const ProtocolTable<Sample> table =
      ProtocolTable<Sample>("Sample", "org.sample.Sample", "/org/sample/Sample")
          .row("pingCompletion:", "Ping", &Sample::ping, {})
          .row("findURL:name:completion:", "Find", &Sample::find, {"URL", "name", "error", "found"})
          .row("storeData:completion:", "Store", &Sample::store, {"data", "stored"});
  return table;
}

/// Answers what it was asked.
class Echo : public Sample {
 public:
  void ping(CompletionHandler<> completion) override {
    ++pings;
    if (completion) completion();
  }
  void find(std::optional<URL> url, std::optional<std::string> name,
            CompletionHandler<SXError, Dictionary> completion) override {
    if (!name) {
      completion(SXInvalidParameterError("name", std::nullopt), std::nullopt);
      return;
    }
    completion(std::nullopt, Dictionary{{"URL", url ? Value(*url) : Value("none")}, {"name", *name}});
  }
  void store(std::optional<Data> data, CompletionHandler<Data> completion) override { completion(std::move(data)); }

  int pings = 0;
};

constexpr std::size_t pingRow = 0;
constexpr std::size_t findRow = 1;
constexpr std::size_t storeRow = 2;
const URL itemURL = *URL::fromString("file:///a");

Arguments invoke(std::size_t row, Arguments arguments) {
  Arguments got;
  ProtocolExporter<Sample> exporter(sampleProtocol(), std::make_shared<Echo>());
  exporter.invoke(row, std::move(arguments), [&got](Arguments values) { got = std::move(values); });
  return got;
}

TEST(ProtocolTable, KindsComeFromTheFunctionsTypes) {
  const ProtocolDescription &description = sampleProtocol().description();
  EXPECT_EQ(description.name, "Sample");
  EXPECT_EQ(description.interfaceName, "org.sample.Sample");
  EXPECT_EQ(description.objectPath, "/org/sample/Sample");
  ASSERT_EQ(description.operations.size(), 3U);
  EXPECT_TRUE(description.operations[pingRow].arguments.empty());
  EXPECT_TRUE(description.operations[pingRow].replies.empty());
  const OperationDescription &find = description.operations[findRow];
  ASSERT_EQ(find.arguments.size(), 2U);
  EXPECT_EQ(find.arguments[0].name, "URL");
  EXPECT_EQ(find.arguments[0].kind, ValueKind::URL);
  EXPECT_EQ(find.arguments[1].kind, ValueKind::string);
  ASSERT_EQ(find.replies.size(), 2U);
  EXPECT_EQ(find.replies[0].kind, ValueKind::error);
  EXPECT_EQ(find.replies[1].name, "found");
  EXPECT_EQ(find.replies[1].kind, ValueKind::dictionary);
  EXPECT_EQ(description.operations[storeRow].arguments[0].kind, ValueKind::data);
}

TEST(ProtocolTable, RowIsFoundByNameAndByMethod) {
  const ProtocolDescription &description = sampleProtocol().description();
  EXPECT_EQ(description.operationNamed("findURL:name:completion:"), &description.operations[findRow]);
  EXPECT_EQ(description.operationNamed("Find"), &description.operations[findRow]);
  EXPECT_EQ(description.operationNamed("find"), nullptr);
}

TEST(ProtocolTable, ArgumentsAndRepliesGoThroughInOrder) {
  EXPECT_EQ(invoke(findRow, {itemURL, "x"}),
            (Arguments{std::nullopt, Value(Dictionary{{"URL", itemURL}, {"name", "x"}})}));
  EXPECT_EQ(invoke(findRow, {itemURL, std::nullopt}),
            (Arguments{Value(SXInvalidParameterError("name", std::nullopt)), std::nullopt}));
  EXPECT_EQ(invoke(storeRow, {Value(Data{"bytes"})}), (Arguments{Value(Data{"bytes"})}));
}

TEST(ProtocolTable, MissingArgumentsAndThoseOfAnotherKindCountAsAbsent) {
  EXPECT_EQ(invoke(findRow, {"not a URL", "x"}),
            (Arguments{std::nullopt, Value(Dictionary{{"URL", "none"}, {"name", "x"}})}));
  EXPECT_EQ(invoke(storeRow, {}), (Arguments{std::nullopt}));
}

TEST(ProtocolTable, EmptyReplyReachesTheOperationAsAnEmptyHandler) {
  const auto echo = std::make_shared<Echo>();
  ProtocolExporter<Sample> exporter(sampleProtocol(), echo);
  exporter.invoke(pingRow, {}, {});
  EXPECT_EQ(echo->pings, 1);
}

TEST(ProtocolTable, IndexThatIsNoRowIsIgnored) { EXPECT_TRUE(invoke(17, {}).empty()); }

TEST(ProtocolTable, PackedReplyIsUnpackedAgain) {
  std::optional<SXError> gotError;
  std::optional<std::string> gotText = "untouched";
  const ReplyHandler reply = unpackingReply(
      CompletionHandler<SXError, std::string>([&](std::optional<SXError> error, std::optional<std::string> text) {
        gotError = std::move(error);
        gotText = std::move(text);
      }));
  packingCompletion<SXError, std::string>(reply)(SXNotPermittedError(), std::nullopt);
  EXPECT_EQ(gotError, SXNotPermittedError());
  EXPECT_FALSE(gotText);
  EXPECT_FALSE(unpackingReply(CompletionHandler<SXError>()));
  EXPECT_FALSE(packingCompletion<SXError>(ReplyHandler()));
}

TEST(LinkInterface, DeclaredKindsBelongToOneArgumentOfOneOperation) {
  LinkInterface interface(sampleProtocol().description());
  EXPECT_EQ(interface.permittedKinds("findURL:name:completion:", 1, true), nullptr);
  interface.setPermittedKinds({ValueKind::string, ValueKind::URL}, "findURL:name:completion:", 1, true);
  const std::set<ValueKind> *kinds = interface.permittedKinds("findURL:name:completion:", 1, true);
  ASSERT_TRUE(kinds);
  EXPECT_EQ(*kinds, (std::set{ValueKind::string, ValueKind::URL}));
  EXPECT_EQ(interface.permittedKinds("findURL:name:completion:", 1, false), nullptr);
  EXPECT_EQ(interface.permittedKinds("findURL:name:completion:", 0, true), nullptr);
  EXPECT_EQ(interface.permittedKinds("pingCompletion:", 1, true), nullptr);
}

TEST(HoldsOnlyKinds, LooksAtEveryDepth) {
  const std::set<ValueKind> kinds{ValueKind::dictionary, ValueKind::string, ValueKind::URL};
  EXPECT_TRUE(holdsOnlyKinds(Dictionary{}, kinds));
  EXPECT_TRUE(holdsOnlyKinds(Dictionary{{"a", Dictionary{{"b", "c"}, {"d", itemURL}}}}, kinds));
  EXPECT_FALSE(holdsOnlyKinds(Dictionary{{"a", 1}}, kinds));
  EXPECT_FALSE(holdsOnlyKinds(Dictionary{{"a", Dictionary{{"b", true}}}}, kinds));
  EXPECT_FALSE(holdsOnlyKinds(Dictionary{{"a", List{}}}, kinds));
  EXPECT_FALSE(holdsOnlyKinds(List{Data{"x"}}, kinds));
  EXPECT_TRUE(holdsOnlyKinds(List{"x"}, kinds));
  EXPECT_TRUE(holdsOnlyKinds("not a container", {}));
}

}  // namespace
}  // namespace storix
