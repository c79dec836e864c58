#include "platform/fake/FakeFileCoordination.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/fake/FakeHostTest.h"

namespace storix::fake {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

const URL itemURL = *URL::fromString("file:///items/a");

class Provider : public KTStorix {
 public:
  Provider(PlatformServices &platform, std::string name)
      : name_(std::move(name)), queue_(platform.createOperationQueue("queue of " + name_)) {}

  std::optional<URL> _providedItemsURL() override { return URL::fileURLWithPath("/items", true); }
  std::shared_ptr<OperationQueue> _providedItemsOperationQueue() override { return queue_; }
  std::optional<std::string> _fileReactorID() override { return name_; }
  [[nodiscard]] bool answers(OptionalMember member) const override {
    return member == OptionalMember::fileReactorID || (member == answered) || answersAll;
  }

  void _provideItemAtURL(std::optional<URL> url, Completion completionHandler) override {
    note("provide " + url->absoluteString());
    completionHandler(std::nullopt);
  }
  void _provideItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID,
                         Completion completionHandler) override {
    note("provide " + url->absoluteString() + " to " + toReaderWithID.value_or("nobody"));
    completionHandler(std::nullopt);
    completionHandler(SXNotPermittedError());
  }
  void _cancelProvidingItemAtURL(std::optional<URL> /*url*/, std::optional<std::string> reader) override {
    note("cancel for " + reader.value_or("nobody"));
  }
  void _writerWithID(std::optional<std::string> writerID, std::optional<URL> /*url*/) override {
    note("written by " + writerID.value_or("nobody"));
  }
  void _providedItemAtURLDidGainPresenterWithID(std::optional<URL> /*url*/, std::optional<std::string> id) override {
    note("gained " + id.value_or("nobody"));
  }
  void _providedItemAtURLDidLosePresenterWithID(std::optional<URL> /*url*/, std::optional<std::string> id) override {
    note("lost " + id.value_or("nobody"));
  }
  void _providedItemAtURLWithPresenterWithIDDidMoveToURL(std::optional<URL> /*url*/, std::optional<std::string> /*id*/,
                                                         std::optional<URL> newURL) override {
    note("moved to " + newURL->absoluteString());
  }

  std::optional<OptionalMember> answered = OptionalMember::provideItemAtURLToReaderWithID;
  bool answersAll = false;
  std::vector<std::string> notes;
  std::vector<std::string> contexts;

 private:
  void note(std::string text) {
    notes.push_back(std::move(text));
    contexts.push_back(currentContext());
  }

  const std::string name_;
  const std::shared_ptr<OperationQueue> queue_;
};

class FakeFileCoordinationTest : public FakeHostTest {
 protected:
  FakeFileCoordination &coordination() { return platform().fileCoordination(); }
  KTStorix::Completion counting() {
    return [this](const std::optional<SXError> & /*error*/) { ++completions_; };
  }

  std::shared_ptr<Provider> provider_ = std::make_shared<Provider>(platform(), "org.a");
  int completions_ = 0;
};

TEST_F(FakeFileCoordinationTest, ReadAsksTheProviderOnItsQueueAndCountsTheFirstAnswer) {
  coordination().addProvider(provider_);
  EXPECT_TRUE(coordination().read(itemURL, "reader", counting()));
  EXPECT_THAT(provider_->notes, IsEmpty());
  runUntilIdle();
  EXPECT_THAT(provider_->notes, ElementsAre("provide file:///items/a to reader"));
  EXPECT_THAT(provider_->contexts, ElementsAre("operation queue queue of org.a"));
  EXPECT_EQ(completions_, 1);
  EXPECT_EQ(platform().trace().count("provided again "), 1U);
}

TEST_F(FakeFileCoordinationTest, MemberThatIsNotAnsweredIsNotCalled) {
  provider_->answered.reset();
  coordination().addProvider(provider_);
  EXPECT_TRUE(coordination().read(itemURL, "reader", counting()));
  EXPECT_FALSE(coordination().cancelRead(itemURL, "reader"));
  EXPECT_FALSE(coordination().finishWriting(itemURL, "writer"));
  EXPECT_FALSE(coordination().gainPresenter(itemURL, "presenter"));
  EXPECT_FALSE(coordination().losePresenter(itemURL, "presenter"));
  EXPECT_FALSE(coordination().movePresented(itemURL, "presenter", itemURL));
  runUntilIdle();
  EXPECT_THAT(provider_->notes, ElementsAre("provide file:///items/a"));
}

TEST_F(FakeFileCoordinationTest, EveryOtherCallbackReachesAProviderThatAnswersIt) {
  provider_->answersAll = true;
  coordination().addProvider(provider_);
  EXPECT_TRUE(coordination().readWithoutReader(itemURL, counting()));
  EXPECT_TRUE(coordination().cancelRead(itemURL, "reader"));
  EXPECT_TRUE(coordination().finishWriting(itemURL, "writer"));
  EXPECT_TRUE(coordination().gainPresenter(itemURL, "presenter"));
  EXPECT_TRUE(coordination().losePresenter(itemURL, "presenter"));
  EXPECT_TRUE(coordination().movePresented(itemURL, "presenter", itemURL));
  runUntilIdle();
  EXPECT_THAT(provider_->notes, ElementsAre("provide file:///items/a", "cancel for reader", "written by writer",
                                            "gained presenter", "lost presenter", "moved to file:///items/a"));
}

TEST_F(FakeFileCoordinationTest, FilesOutsideEveryProviderAreNobodys) {
  coordination().addProvider(provider_);
  EXPECT_FALSE(coordination().read(*URL::fromString("file:///itemsx/a"), "reader", counting()));
  EXPECT_FALSE(coordination().read(*URL::fromString("file:///items/"), "reader", counting()));
}

TEST_F(FakeFileCoordinationTest, WithdrawnProviderIsAskedNothingMore) {
  coordination().addProvider(provider_);
  coordination().addProvider(provider_);
  EXPECT_EQ(coordination().providers().size(), 2U);
  EXPECT_TRUE(coordination().read(itemURL, "reader", counting()));
  coordination().removeProvider(provider_);
  coordination().removeProvider(provider_);
  runUntilIdle();
  EXPECT_THAT(coordination().providers(), IsEmpty());
  EXPECT_THAT(provider_->notes, IsEmpty());
}

TEST_F(FakeFileCoordinationTest, ProvidersAreTracedByName) {
  platform().trace().take();
  coordination().addProvider(provider_);
  coordination().removeProvider(provider_);
  EXPECT_THAT(platform().trace().take(), ElementsAre("addProvider org.a", "removeProvider org.a"));
}

}  // namespace
}  // namespace storix::fake
