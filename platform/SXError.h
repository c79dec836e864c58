#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/URL.h"
#include "platform/Value.h"

namespace storix {

/// An error value: domain, code and a dictionary of details. Errors are values everywhere; none is
/// ever thrown. The key "description" holds a sentence for people.
class SXError {
 public:
  SXError(std::string domain, std::int64_t code, Dictionary details = {})
      : domain_(std::move(domain)), code_(code), details_(std::move(details)) {}

  [[nodiscard]] const std::string &domain() const { return domain_; }
  [[nodiscard]] std::int64_t code() const { return code_; }
  [[nodiscard]] const Dictionary &details() const { return details_; }

  /// The detail of that key when it is a string, URL or error; none or null otherwise.
  [[nodiscard]] std::optional<std::string> stringDetail(std::string_view key) const;
  [[nodiscard]] std::optional<URL> urlDetail(std::string_view key) const;
  /// Points into this error.
  [[nodiscard]] const SXError *underlyingError() const;

  /// The "description" detail, or the domain and code where there is none.
  [[nodiscard]] std::string message() const;

  friend bool operator==(const SXError &, const SXError &) = default;

 private:
  std::string domain_;
  std::int64_t code_;
  Dictionary details_;
};

inline constexpr std::string_view storixErrorDomain = "com.tessel.storix";
inline constexpr std::string_view filesErrorDomain = "com.tessel.files";
inline constexpr std::string_view posixErrorDomain = "posix";

/// Codes in `storixErrorDomain`. Clients rely on them; never renumber.
enum class SXErrorCode : std::int64_t {
  clientLacksEntitlement = 1,
  invalidParameter = 2,
  notFound = 3,
  notFoundURL = 4,
  notPermitted = 5,
  pluginOperationFailed = 6,
  proxyNotFound = 7,
  sandboxExtensionFailed = 8,
  invalidBookmarkableString = 9,
};

/// The daemon's own errors. Each fills "description" and, where there is one, the detail named.
SXError SXClientLacksEntitlement();
/// Details "parameter", and "value" where one is given.
SXError SXInvalidParameterError(std::string parameter, std::optional<std::string> value);
/// Detail "providerIdentifier".
SXError SXNotFoundError(std::optional<std::string> providerIdentifier);
/// Detail "URL".
SXError SXNotFoundErrorURL(std::optional<URL> url);
SXError SXNotPermittedError();
/// Detail "underlyingError". Also without an underlying error this is an error value: a stop
/// request's reply always carries one, and the absence of "underlyingError" in it means success.
SXError SXPluginOperationFailedError(std::optional<SXError> underlyingError);
/// Detail "providerIdentifier", and "underlyingError" where one is given.
SXError SXProxyNotFoundError(std::optional<std::string> providerIdentifier, std::optional<SXError> underlyingError);
/// Detail "URL".
SXError SXSandboxExtensionFailedError(std::optional<URL> url);
SXError SXInvalidBookmarkableStringError();

/// An error of the operating system: domain "posix", the errno as code. `doing` says what was tried
/// and on what, and becomes part of the description.
SXError posixError(int errorNumber, std::string_view doing);

/// The error of a directory comparison whose directory does not exist: domain "com.tessel.files",
/// code 260, detail "URL".
SXError fileNotFoundForReading(const URL &url);
bool isFileNotFoundForReading(const SXError &error);

}  // namespace storix
