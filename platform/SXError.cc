#include "platform/SXError.h"

#include <system_error>

namespace storix {
namespace {

constexpr std::int64_t fileNotFoundForReadingCode = 260;

SXError storixError(SXErrorCode code, std::string description, Dictionary details = {}) {
  details.insert_or_assign("description", std::move(description));
  return SXError(std::string(storixErrorDomain), static_cast<std::int64_t>(code), std::move(details));
}

std::string quoted(const std::string &text) { return "“" + text + "”"; }

}  // namespace

std::optional<std::string> SXError::stringDetail(std::string_view key) const {
  const auto found = details_.find(key);
  const std::string *text = found == details_.end() ? nullptr : found->second.string();
  return text ? std::optional(*text) : std::nullopt;
}

std::optional<URL> SXError::urlDetail(std::string_view key) const {
  const auto found = details_.find(key);
  const URL *url = found == details_.end() ? nullptr : found->second.url();
  return url ? std::optional(*url) : std::nullopt;
}

const SXError *SXError::underlyingError() const {
  const auto found = details_.find("underlyingError");
  return found == details_.end() ? nullptr : found->second.error();
}

std::string SXError::message() const {
  if (std::optional<std::string> description = stringDetail("description")) return *std::move(description);
  return domain_ + " " + std::to_string(code_);
}

SXError SXClientLacksEntitlement() {
  return storixError(SXErrorCode::clientLacksEntitlement,
                     "The application is not entitled to this request. Its entitlements must hold "
                     "“com.tessel.storix.acl-write”, or for most requests “com.tessel.storix.acl-read”.");
}

SXError SXInvalidParameterError(std::string parameter, std::optional<std::string> value) {
  Dictionary details;
  std::string description = value ? "The parameter " + quoted(parameter) + " does not fit: " + quoted(*value) + "."
                                  : "The parameter " + quoted(parameter) + " is missing. Give it a value.";
  if (value) details.emplace("value", *std::move(value));
  details.emplace("parameter", std::move(parameter));
  return storixError(SXErrorCode::invalidParameter, std::move(description), std::move(details));
}

SXError SXNotFoundError(std::optional<std::string> providerIdentifier) {
  if (!providerIdentifier) return storixError(SXErrorCode::notFound, "No document provider was named.");
  std::string description = "There is no document provider " + quoted(*providerIdentifier) +
                            ". Look at the list of providers for those that are installed.";
  return storixError(SXErrorCode::notFound, std::move(description),
                     {{"providerIdentifier", *std::move(providerIdentifier)}});
}

SXError SXNotFoundErrorURL(std::optional<URL> url) {
  if (!url) return storixError(SXErrorCode::notFoundURL, "No URL was given, so no document provider owns it.");
  return storixError(SXErrorCode::notFoundURL,
                     "No document provider owns " + url->absoluteString() +
                         ". The URL must lie below the document storage of an installed provider.",
                     {{"URL", *url}});
}

SXError SXNotPermittedError() {
  return storixError(SXErrorCode::notPermitted,
                     "The application may not have this document. Access to it must be granted first.");
}

SXError SXPluginOperationFailedError(std::optional<SXError> underlyingError) {
  if (!underlyingError) {
    return storixError(SXErrorCode::pluginOperationFailed, "The document provider gave no error for the operation.");
  }
  std::string description = "The document provider could not do it: " + underlyingError->message();
  return storixError(SXErrorCode::pluginOperationFailed, std::move(description),
                     {{"underlyingError", *std::move(underlyingError)}});
}

SXError SXProxyNotFoundError(std::optional<std::string> providerIdentifier, std::optional<SXError> underlyingError) {
  std::string description = providerIdentifier
                                ? "The document provider " + quoted(*providerIdentifier) + " could not be reached."
                                : std::string("The document provider could not be reached.");
  description += " Try again; if that fails too, the provider's own log says why.";
  Dictionary details;
  if (providerIdentifier) details.emplace("providerIdentifier", *std::move(providerIdentifier));
  if (underlyingError) details.emplace("underlyingError", *std::move(underlyingError));
  return storixError(SXErrorCode::proxyNotFound, std::move(description), std::move(details));
}

SXError SXSandboxExtensionFailedError(std::optional<URL> url) {
  if (!url) return storixError(SXErrorCode::sandboxExtensionFailed, "No URL was given to extend the sandbox for.");
  return storixError(SXErrorCode::sandboxExtensionFailed,
                     "The sandbox could not be extended for " + url->absoluteString() + ".", {{"URL", *url}});
}

SXError SXInvalidBookmarkableStringError() {
  return storixError(SXErrorCode::invalidBookmarkableString,
                     "The text is not a bookmark of a document. A bookmark reads “storix:”, the provider's identifier, "
                     "“/” and the item's identifier.");
}

SXError posixError(int errorNumber, std::string_view doing) {
  std::string description(doing);
  description += ": " + std::generic_category().message(errorNumber);
  return SXError(std::string(posixErrorDomain), errorNumber, {{"description", std::move(description)}});
}

SXError fileNotFoundForReading(const URL &url) {
  return SXError(std::string(filesErrorDomain), fileNotFoundForReadingCode,
                 {{"description", "There is nothing at " + url.absoluteString() + "."}, {"URL", url}});
}

bool isFileNotFoundForReading(const SXError &error) {
  return error.domain() == filesErrorDomain && error.code() == fileNotFoundForReadingCode;
}

}  // namespace storix
