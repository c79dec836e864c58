#include "service/ItemSandboxTokens.h"

#include <string>
#include <utility>

#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"

namespace storix {

namespace {

std::optional<Data> tokenDataForURL(const std::optional<URL> &url) {
  if (!url) return std::nullopt;
  std::optional<std::string> token = ProcessScope::current().platform().issueSandboxExtension(
      SandboxExtensionClass::readWrite, url->fileSystemRepresentation(), 0);
  if (!token) return std::nullopt;
  return Data{std::move(*token)};
}

}  // namespace

std::optional<URL> companionURLForURL(const std::optional<URL> &url) {
  if (!url) return std::nullopt;
  // On the text and not on the path, so that percent escapes stay as they are.
  const std::string &text = url->absoluteString();
  return URL::fromString(
      stringByAppendingPathComponent(stringByDeletingLastPathComponent(text), "." + stringLastPathComponent(text)));
}

bool issueItemSandboxTokens(const std::optional<URL> &url, std::optional<Data> *outTokenData,
                            std::optional<URL> *outCompanionURL, std::optional<Data> *outCompanionTokenData) {
  std::optional<URL> companionURL = companionURLForURL(url);
  std::optional<Data> tokenData = tokenDataForURL(url);
  std::optional<Data> companionTokenData = tokenDataForURL(companionURL);
  if (outTokenData) *outTokenData = std::move(tokenData);
  if (outCompanionURL) *outCompanionURL = std::move(companionURL);
  if (outCompanionTokenData) *outCompanionTokenData = std::move(companionTokenData);
  return true;
}

}  // namespace storix
