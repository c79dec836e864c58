#include "providers/SXExtensionStorix.h"

#include <functional>
#include <tuple>
#include <vector>

#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using fake::completeProvider;
using fake::FakeExtension;
using fake::LogLine;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class SXExtensionStorixTest : public ProvidersTest {
 protected:
  std::shared_ptr<SXExtensionStorix> make(const FakeExtension &extension) {
    platform().extensions().install(extension);
    return SXExtensionStorix::initWithExtension(platform().extensions().makeRecord(extension));
  }

  void expectNoDirectory(const FakeExtension &extension, const std::string &line) {
    const std::shared_ptr<SXExtensionStorix> provider = make(extension);
    EXPECT_EQ(provider->providedItemsURL(), std::nullopt);
    EXPECT_EQ(provider->identifier(), extension.identifier);
    EXPECT_THAT(platform().log().take(), ElementsAre(LogLine{LogSeverity::fault, line}));
  }
};

TEST_F(SXExtensionStorixTest, ConstructionMakesTheQueuesAndDerivesTheDirectory) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  EXPECT_THAT(trace(), ElementsAre("createOperationQueue Operation queue for org.a",
                                   "createConcurrentQueue SXExtensionStorix concurrent member queue for org.a",
                                   "bundleRecordForIdentifier org.a",
                                   "infoDictionaryValue org.a KTExtension dictionary", "groupContainerURLs org.a"));
  EXPECT_EQ(provider->providedItemsURL(), storageURL("org.a"));
  EXPECT_TRUE(provider->providedItemsURL()->hasDirectoryPath());
  EXPECT_EQ(provider->identifier(), "org.a");
  EXPECT_EQ(provider->extension()->description(), "org.a version 1");
}

TEST_F(SXExtensionStorixTest, TheQueuesCarryTheIdentifier) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  EXPECT_EQ(provider->operationQueue()->name(), "Operation queue for org.a");
  EXPECT_EQ(provider->memberQueue()->label(), "SXExtensionStorix concurrent member queue for org.a");
}

TEST_F(SXExtensionStorixTest, TheCoordinatorsNamesGiveTheSameValues) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  EXPECT_EQ(provider->_providedItemsURL(), storageURL("org.a"));
  EXPECT_EQ(provider->_fileReactorID(), "org.a");
  EXPECT_EQ(provider->_providedItemsOperationQueue(), provider->operationQueue());
}

TEST_F(SXExtensionStorixTest, ABundleWithoutARecordLeavesNoDirectory) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle = std::nullopt;
  expectNoDirectory(extension, "[ERROR] Cannot instantiate a Appdex proxy for org.a version 1");
}

TEST_F(SXExtensionStorixTest, AMissingExtensionDictionaryLeavesNoDirectory) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle->info.clear();
  expectNoDirectory(extension, "[ERROR] Cannot read KTExtension dictionary from the Info.kvs of org.a version 1");
}

TEST_F(SXExtensionStorixTest, AnExtensionEntryThatIsNoDictionaryLeavesNoDirectory) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle->info.insert_or_assign("KTExtension", "text");
  expectNoDirectory(extension, "[ERROR] Cannot read KTExtension dictionary from the Info.kvs of org.a version 1");
}

TEST_F(SXExtensionStorixTest, AMissingGroupLeavesNoDirectory) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle->info.insert_or_assign("KTExtension", Dictionary());
  expectNoDirectory(extension,
                    "[ERROR] Cannot read KTExtensionStorixDocumentGroup key from the Info.kvs of org.a version 1");
}

TEST_F(SXExtensionStorixTest, AGroupThatIsNoStringLeavesNoDirectory) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle->info.insert_or_assign("KTExtension", Dictionary{{"KTExtensionStorixDocumentGroup", 5}});
  expectNoDirectory(extension,
                    "[ERROR] Cannot read KTExtensionStorixDocumentGroup key from the Info.kvs of org.a version 1");
}

TEST_F(SXExtensionStorixTest, AGroupWithoutAContainerLeavesNoDirectory) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle->groupContainers.clear();
  expectNoDirectory(extension, "[ERROR] Cannot deduce the provided items URL for org.a version 1");
}

TEST_F(SXExtensionStorixTest, SettersReturnBeforeTheValueIsStoredAndReadsAfterThemSeeIt) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  const std::shared_ptr<ExtensionRecord> record = platform().extensions().makeRecord(completeProvider("org.a", "2"));
  provider->setIdentifier("org.b");
  provider->setProvidedItemsURL(itemURL("org.a", "x"));
  provider->setExtension(record);
  EXPECT_EQ(provider->memberQueueIdentifier(), "org.a");
  EXPECT_EQ(provider->memberQueueProvidedItemsURL(), storageURL("org.a"));
  EXPECT_NE(provider->memberQueueExtension(), record);
  EXPECT_EQ(provider->identifier(), "org.b");
  EXPECT_EQ(provider->providedItemsURL(), itemURL("org.a", "x"));
  EXPECT_EQ(provider->extension(), record);
}

TEST_F(SXExtensionStorixTest, SettersWaitForTheReadersBeforeThem) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  const std::vector<std::function<void()>> setters{
      [&provider] { provider->setIdentifier("org.b"); },
      [&provider] { provider->setProvidedItemsURL(std::nullopt); },
      [this, &provider] { provider->setExtension(platform().extensions().makeRecord(completeProvider("org.b"))); },
  };
  const auto values = [&provider] {
    return std::tuple(provider->memberQueueIdentifier(), provider->memberQueueProvidedItemsURL(),
                      provider->memberQueueExtension());
  };
  for (const std::function<void()> &set : setters) {
    const auto before = values();
    bool wasRead = false;
    provider->memberQueue()->async([this, &values, &before, &wasRead] {
      // Whatever could run beside this reader runs now.
      while (platform().runOne()) continue;
      EXPECT_EQ(values(), before);
      wasRead = true;
    });
    set();
    runUntilIdle();
    EXPECT_TRUE(wasRead);
    EXPECT_NE(values(), before);
  }
}

TEST_F(SXExtensionStorixTest, WithoutAnIdentifierOfItsOwnItHasThatOfTheRecord) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  provider->setIdentifier(std::nullopt);
  EXPECT_EQ(provider->identifier(), "org.a");
}

TEST_F(SXExtensionStorixTest, ThePlainAccessorsWriteTheFieldsAtOnce) {
  const std::shared_ptr<SXExtensionStorix> provider = make(completeProvider("org.a"));
  const std::shared_ptr<ExtensionRecord> record = platform().extensions().makeRecord(completeProvider("org.a", "2"));
  provider->setMemberQueueIdentifier("org.b");
  provider->setMemberQueueProvidedItemsURL(std::nullopt);
  provider->setMemberQueueExtension(record);
  EXPECT_EQ(provider->memberQueueIdentifier(), "org.b");
  EXPECT_EQ(provider->memberQueueProvidedItemsURL(), std::nullopt);
  EXPECT_EQ(provider->memberQueueExtension(), record);
  const std::shared_ptr<OperationQueue> operations = platform().createOperationQueue("o");
  provider->setOperationQueue(operations);
  EXPECT_EQ(provider->operationQueue(), operations);
  const std::shared_ptr<ConcurrentQueue> members = platform().createConcurrentQueue("m");
  provider->setMemberQueue(members);
  EXPECT_EQ(provider->memberQueue(), members);
}

TEST_F(SXExtensionStorixTest, ItsEndWithdrawsNothing) {
  make(completeProvider("org.a"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("removeProvider"), 0U);
  EXPECT_THAT(platform().log().take(), IsEmpty());
}

}  // namespace
}  // namespace storix
