#include "platform/SXError.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>

#include "platform/Result.h"

namespace storix {
namespace {

using testing::HasSubstr;

const URL itemURL = *URL::fromString("file:///a/b%20c");

void expectStorixError(const SXError &error, std::int64_t code, std::size_t detailCount) {
  EXPECT_EQ(error.domain(), "com.tessel.storix");
  EXPECT_EQ(error.code(), code);
  EXPECT_EQ(error.details().size(), detailCount);
  EXPECT_FALSE(error.stringDetail("description").value_or("").empty());
}

TEST(SXError, LackingEntitlementSaysWhichOnesHelp) {
  const SXError error = SXClientLacksEntitlement();
  expectStorixError(error, 1, 1);
  EXPECT_THAT(error.message(), HasSubstr("com.tessel.storix.acl-write"));
}

TEST(SXError, InvalidParameterCarriesItsNameAndItsValueWhereThereIsOne) {
  const SXError missing = SXInvalidParameterError("URL", std::nullopt);
  expectStorixError(missing, 2, 2);
  EXPECT_EQ(missing.stringDetail("parameter"), "URL");
  EXPECT_FALSE(missing.stringDetail("value"));
  const SXError mismatch = SXInvalidParameterError("providerID", "org.a");
  expectStorixError(mismatch, 2, 3);
  EXPECT_EQ(mismatch.stringDetail("parameter"), "providerID");
  EXPECT_EQ(mismatch.stringDetail("value"), "org.a");
  EXPECT_EQ(SXInvalidParameterError("URL", "").stringDetail("value"), "");
}

TEST(SXError, NotFoundCarriesTheProviderIdentifier) {
  const SXError error = SXNotFoundError("org.a");
  expectStorixError(error, 3, 2);
  EXPECT_EQ(error.stringDetail("providerIdentifier"), "org.a");
  EXPECT_THAT(error.message(), HasSubstr("“org.a”"));
  expectStorixError(SXNotFoundError(std::nullopt), 3, 1);
}

TEST(SXError, NotFoundURLCarriesTheURL) {
  const SXError error = SXNotFoundErrorURL(itemURL);
  expectStorixError(error, 4, 2);
  EXPECT_EQ(error.urlDetail("URL"), itemURL);
  expectStorixError(SXNotFoundErrorURL(std::nullopt), 4, 1);
}

TEST(SXError, NotPermittedHasADescriptionAlone) { expectStorixError(SXNotPermittedError(), 5, 1); }

TEST(SXError, FailedPluginOperationCarriesTheUnderlyingErrorWhereThereIsOne) {
  const SXError error = SXPluginOperationFailedError(posixError(ENOENT, "Cannot open /a"));
  expectStorixError(error, 6, 2);
  ASSERT_TRUE(error.underlyingError());
  EXPECT_EQ(*error.underlyingError(), posixError(ENOENT, "Cannot open /a"));
  EXPECT_THAT(error.message(), HasSubstr("Cannot open /a"));
  const SXError success = SXPluginOperationFailedError(std::nullopt);
  expectStorixError(success, 6, 1);
  EXPECT_FALSE(success.underlyingError());
}

TEST(SXError, ProxyNotFoundCarriesTheProviderIdentifier) {
  const SXError error = SXProxyNotFoundError("org.a", std::nullopt);
  expectStorixError(error, 7, 2);
  EXPECT_EQ(error.stringDetail("providerIdentifier"), "org.a");
  EXPECT_FALSE(error.underlyingError());
  const SXError caused = SXProxyNotFoundError("org.a", SXNotPermittedError());
  expectStorixError(caused, 7, 3);
  EXPECT_EQ(*caused.underlyingError(), SXNotPermittedError());
  expectStorixError(SXProxyNotFoundError(std::nullopt, std::nullopt), 7, 1);
}

TEST(SXError, FailedSandboxExtensionCarriesTheURL) {
  const SXError error = SXSandboxExtensionFailedError(itemURL);
  expectStorixError(error, 8, 2);
  EXPECT_EQ(error.urlDetail("URL"), itemURL);
  expectStorixError(SXSandboxExtensionFailedError(std::nullopt), 8, 1);
}

TEST(SXError, InvalidBookmarkSaysWhatOneLooksLike) {
  const SXError error = SXInvalidBookmarkableStringError();
  expectStorixError(error, 9, 1);
  EXPECT_THAT(error.message(), HasSubstr("storix:"));
}

TEST(SXError, OperatingSystemErrorSaysWhatWasTriedAndWhy) {
  const SXError error = posixError(ENOENT, "Cannot open /a");
  EXPECT_EQ(error.domain(), "posix");
  EXPECT_EQ(error.code(), ENOENT);
  EXPECT_EQ(error.message(), "Cannot open /a: No such file or directory");
}

TEST(SXError, MissingDirectoryIsRecognisedAndCarriesItsURL) {
  const SXError error = fileNotFoundForReading(itemURL);
  EXPECT_EQ(error.domain(), "com.tessel.files");
  EXPECT_EQ(error.code(), 260);
  EXPECT_EQ(error.urlDetail("URL"), itemURL);
  EXPECT_TRUE(isFileNotFoundForReading(error));
  EXPECT_FALSE(isFileNotFoundForReading(SXError("com.tessel.files", 261)));
  EXPECT_FALSE(isFileNotFoundForReading(SXError("com.tessel.storix", 260)));
}

TEST(SXError, DetailsOfAnotherKindCountAsMissing) {
  const SXError error("d", 1, {{"description", 7}, {"URL", "file:///a"}, {"underlyingError", "text"}});
  EXPECT_FALSE(error.stringDetail("description"));
  EXPECT_FALSE(error.urlDetail("URL"));
  EXPECT_FALSE(error.underlyingError());
  EXPECT_FALSE(error.stringDetail("absent"));
  EXPECT_EQ(error.message(), "d 1");
}

TEST(SXError, EqualityLooksAtDomainCodeAndDetails) {
  EXPECT_EQ(SXError("d", 1, {{"k", "v"}}), SXError("d", 1, {{"k", "v"}}));
  EXPECT_NE(SXError("d", 1, {{"k", "v"}}), SXError("d", 1, {{"k", "w"}}));
  EXPECT_NE(SXError("d", 1), SXError("d", 2));
  EXPECT_NE(SXError("d", 1), SXError("e", 1));
}

TEST(Result, HoldsAValueOrAnError) {
  const Result<std::string> good(std::string("text"));
  EXPECT_TRUE(good.ok());
  EXPECT_EQ(good.value(), "text");
  const Result<std::string> bad(SXNotPermittedError());
  EXPECT_FALSE(bad);
  EXPECT_EQ(bad.error(), SXNotPermittedError());
}

}  // namespace
}  // namespace storix
