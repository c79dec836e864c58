#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAreArray;

constexpr const char *identify = "IdentifierForItemAtURL";

class BookmarkableStringRequestTest : public ServicerTest {
 protected:
  static constexpr std::string_view name = SXDaemon::bookmarkableStringName;

  void SetUp() override {
    ServicerTest::SetUp();
    connect({});
  }

  static Arguments request(const std::optional<URL> &url) { return packArguments<URL>(url); }

  /// The first lines, which check nothing.
  [[nodiscard]] std::vector<std::string> start(const std::optional<URL> &url) const {
    return {"request peer 100 " + std::string(name) + " (" + logDescription(url) + ")",
            "log debug [DEBUG] Getting bookmarkable string for URL " + logDescription(url)};
  }
};

TEST_F(BookmarkableStringRequestTest, AnyClientGetsTheStringOfAnItem) {
  call(name, request(item_));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start(item_),
                                                ownerFound(),
                                                identification("org.a", "request-3", *item_),
                                                {"log debug [DEBUG] Successfully generated bookmarkable string "
                                                 "“storix:org.a/f/i” from URL " +
                                                     itemText() + ".",
                                                 reply(name, "(storix:org.a/f/i, (null))", platformThread),
                                                 cancel("org.a", "request-3")}})));
  EXPECT_FALSE(platform().files().exists("/home/u/Library/Storix/AccessControl.kvs"));
}

TEST_F(BookmarkableStringRequestTest, AURLOutsideEveryProviderGetsNeitherStringNorError) {
  const std::optional<URL> url = URL::fromString("file:///elsewhere");
  call(name, request(url));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({start(url),
                                       {compared("org.a", *url), compared("org.b", *url),
                                        "log info [INFO] Could not find the provider for URL file:///elsewhere",
                                        reply(name, "((null), (null))", global)}})));
}

TEST_F(BookmarkableStringRequestTest, AnAbsentURLIsNobodys) {
  call(name, request(std::nullopt));
  std::vector<std::string> lookup;
  for (const char *provider : {"org.a", "org.b"}) {
    lookup.push_back("directoryRelationship " + storageText(provider) + " (null)");
    lookup.push_back("log fault [ERROR] Cannot get the relationship between URL " + storageText(provider) +
                     " and (null). Error: posix 22 \"Cannot compare an item without a URL: Invalid argument\"");
  }
  EXPECT_THAT(trace(), ElementsAreArray(joined({start(std::nullopt),
                                                lookup,
                                                {"log info [INFO] Could not find the provider for URL (null)",
                                                 reply(name, "((null), (null))", global)}})));
}

TEST_F(BookmarkableStringRequestTest, TheProviderObjectsErrorIsPassedOnUnchanged) {
  const SXError error = someError("no such item");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(error), Argument("f/i")}));
  call(name, request(item_));
  EXPECT_THAT(trace(), ElementsAreArray(joined(
                           {start(item_),
                            ownerFound(),
                            failedIdentification("org.a", "request-3", *item_, "(" + text(error) + ", f/i)", error),
                            {reply(name, "((null), " + text(SXPluginOperationFailedError(error)) + ")", platformThread),
                             cancel("org.a", "request-3")}})));
}

TEST_F(BookmarkableStringRequestTest, NeitherIdentifierNorErrorIsAnErrorLineAndAnEmptyReply) {
  process("org.a").setAnswer(identify, VendorAnswer::values());
  call(name, request(item_));
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {start(item_),
           ownerFound(),
           message("itemIDForURL:completionHandler:", "org.a", "request-3",
                   "_identifierForItemAtURL:completion:", itemText(), "()"),
           {"log debug [DEBUG] Successfully got item ID “(null)” for URL " + itemText() + " from extension org.a",
            "log fault [ERROR] Could not get Item ID for URL " + itemText() + ".",
            reply(name, "((null), (null))", platformThread), cancel("org.a", "request-3")}})));
}

TEST_F(BookmarkableStringRequestTest, NeedsNoReplyHandler) {
  client_->callWithoutReply(name, request(item_));
  client_->callWithoutReply(name, request(URL::fromString("file:///elsewhere")));
  runUntilIdle();
  process("org.a").setAnswer(identify, VendorAnswer::values());
  client_->callWithoutReply(name, request(item_));
  process("org.a").setBeginFailure(someError("no process"));
  client_->callWithoutReply(name, request(item_));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

TEST_F(BookmarkableStringRequestTest, WhereThePathReallyLeadsDecidesWhoOwnsIt) {
  platform().files().makeDirectory("/elsewhere");
  platform().files().makeSymbolicLink(storagePath("org.a") + "/out", "/elsewhere");
  platform().files().makeSymbolicLink("/elsewhere/in", storagePath("org.a"));
  const auto isOwned = [this](const std::string &url) {
    const std::shared_ptr<fake::FakeReply> answered = call(name, request(URL::fromString(url)));
    EXPECT_EQ(answered->error(1), std::nullopt) << url;
    return answered->answer().values.at(0) == Argument("storix:org.a/f/i");
  };
  const std::string directory = storageText("org.a");
  EXPECT_TRUE(isOwned(directory + "not/made/yet"));
  EXPECT_TRUE(isOwned(directory + "a/../b"));
  EXPECT_TRUE(isOwned(directory + "../Storix%20Storage/b"));
  EXPECT_TRUE(isOwned("file:///elsewhere/in/b"));
  EXPECT_FALSE(isOwned(directory + "../b"));
  EXPECT_FALSE(isOwned(directory + "out/b"));
  EXPECT_FALSE(isOwned("file:///"));
  EXPECT_EQ(platform().log().take().empty(), false);
}

TEST_F(BookmarkableStringRequestTest, AProvidersDirectoryItselfIsNobodys) {
  const std::optional<URL> directory = storageURL("org.a");
  call(name, request(directory));
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined({start(directory),
                               {compared("org.a", *directory),
                                "log debug [DEBUG] Ignoring URLs that exactly match the document container folder",
                                "log info [INFO] Could not find the provider for URL " + directory->absoluteString(),
                                reply(name, "((null), (null))", global)}})));
}

TEST_F(BookmarkableStringRequestTest, AProviderWithoutADirectoryOwnsNothingYet) {
  platform().files().remove(storagePath("org.a"));
  call(name, request(item_));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {start(item_),
                   {compared("org.a", *item_),
                    "log debug [DEBUG] Storix provider org.a doesn't have a provided items directory; it "
                    "may not have run so far.",
                    compared("org.b", *item_), "log info [INFO] Could not find the provider for URL " + itemText(),
                    reply(name, "((null), (null))", global)}})));
}

TEST_F(BookmarkableStringRequestTest, ALateConnectionFailureRepliesAgainWithAnError) {
  const SXError error = someError("it ended");
  process("org.a").setAnswer(identify, VendorAnswer::valuesThenConnectionFailure({Argument(), Argument("f/i")}, error));
  const std::shared_ptr<fake::FakeReply> answered = call(name, request(item_));
  ASSERT_EQ(answered->answers().size(), 2U);
  EXPECT_EQ(answered->answer().values, (Arguments{Argument("storix:org.a/f/i"), Argument()}));
  EXPECT_EQ(answered->answers()[1].values, (Arguments{Argument(), Argument(SXPluginOperationFailedError(error))}));
}

}  // namespace
}  // namespace storix
