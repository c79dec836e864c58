#include "examples/webdav-provider/Configuration.h"

#include <curl/curl.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>

#include "examples/webdav-provider/KeyedValues.h"
#include "wire/UniqueFd.h"

namespace storix::example {

namespace {

constexpr std::size_t fileAtMost = 64 * 1024;
constexpr const char *defaultCredentialsFile = "WebDAV Credentials.kvs";

SXError wrong(const std::string &file, const std::string &sentence) {
  return posixError(EINVAL, "reading " + file + ": " + sentence);
}

class ParsedURL {
 public:
  explicit ParsedURL(const std::string &text) : url_(::curl_url(), &::curl_url_cleanup) {
    good_ = url_ && ::curl_url_set(url_.get(), CURLUPART_URL, text.c_str(), CURLU_NON_SUPPORT_SCHEME) == CURLUE_OK;
  }
  [[nodiscard]] bool good() const { return good_; }
  [[nodiscard]] std::string part(CURLUPart which) const {
    char *text = nullptr;
    if (::curl_url_get(url_.get(), which, &text, 0) != CURLUE_OK) return {};
    std::string copy(text);
    ::curl_free(text);
    return copy;
  }

 private:
  std::unique_ptr<CURLU, decltype(&::curl_url_cleanup)> url_;
  bool good_ = false;
};

bool isThisMachine(const std::string &host) {
  return host == "localhost" || host == "[::1]" || host.starts_with("127.");
}

/// The opened file decides, not its name: nobody can put another in its place in between.
Result<HttpCredentials> readCredentials(const std::string &file) {
  const UniqueFd opened(::open(file.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  if (!opened) return posixError(errno, "opening " + file);
  struct stat status {};
  if (::fstat(opened.get(), &status) != 0) return posixError(errno, "looking at " + file);
  if (!S_ISREG(status.st_mode)) return wrong(file, "it must be an ordinary file");
  if (status.st_uid != ::geteuid()) return posixError(EPERM, file + " must belong to you; make it anew");
  if ((status.st_mode & 077U) != 0) {
    return posixError(EPERM,
                      file + " holds a password and others may open it; close it with: chmod 600 '" + file + "'");
  }
  const auto text = readWhole(opened.get(), fileAtMost);
  if (!text) return posixError(static_cast<int>(text.error().code()), "reading " + file);
  // The parser's words stay out: they must not quote a password.
  const auto values = KeyedValues::parse(text.value());
  if (!values) return wrong(file, R"(it must look like {"Name": "...", "Password": "..."})");
  auto name = values->string("Name");
  auto password = values->string("Password");
  if (!name || name->empty() || !password) return wrong(file, R"("Name" and "Password" must be texts)");
  if (name->find(':') != std::string::npos) return wrong(file, "a name cannot hold a colon");
  return HttpCredentials{*std::move(name), *std::move(password)};
}

}  // namespace

Result<DavSettings> readConfiguration(const std::string &groupContainer) {
  const std::string file = groupContainer + "/WebDAV.kvs";
  const UniqueFd opened(::open(file.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  if (!opened) return posixError(errno, "opening " + file + ", which must name the server's \"URL\"");
  const auto text = readWhole(opened.get(), fileAtMost);
  if (!text) return posixError(static_cast<int>(text.error().code()), "reading " + file);
  std::string reason;
  const auto parsed = KeyedValues::parse(text.value(), &reason);
  if (!parsed) return wrong(file, reason);
  const KeyedValues &values = *parsed;

  const auto address = values.string("URL");
  if (!address || address->empty()) return wrong(file, "\"URL\" must be the address of the WebDAV folder");
  const ParsedURL url(*address);
  if (!url.good()) return wrong(file, "\"URL\" is not an address");
  if (!url.part(CURLUPART_USER).empty() || !url.part(CURLUPART_PASSWORD).empty()) {
    return wrong(file, "\"URL\" must not hold a name or password; put them into the credentials file");
  }
  const std::string scheme = url.part(CURLUPART_SCHEME);
  if (scheme != "http" && scheme != "https") return wrong(file, "\"URL\" must begin with https: or http:");
  if (!url.part(CURLUPART_QUERY).empty() || !url.part(CURLUPART_FRAGMENT).empty()) {
    return wrong(file, "\"URL\" must not hold a \"?\" or \"#\"");
  }
  if (values.has("CredentialsFile") && !values.string("CredentialsFile")) {
    return wrong(file, "\"CredentialsFile\" must be a path");
  }
  if (values.has("AllowPlainHTTP") && !values.boolean("AllowPlainHTTP")) {
    return wrong(file, "\"AllowPlainHTTP\" must be true or false");
  }

  DavSettings settings;
  settings.url = url.part(CURLUPART_URL);
  if (!settings.url.ends_with('/')) settings.url += '/';
  settings.http.mayUsePlainHttp = scheme == "http";

  const auto named = values.string("CredentialsFile");
  settings.credentialsFile = named.value_or(defaultCredentialsFile);
  if (!settings.credentialsFile.starts_with('/'))
    settings.credentialsFile = groupContainer + "/" + settings.credentialsFile;
  auto credentials = readCredentials(settings.credentialsFile);
  if (credentials) {
    settings.http.credentials = std::move(credentials.value());
  } else if (named || credentials.error().code() != ENOENT) {
    return credentials.error();
  }
  if (settings.http.credentials && scheme == "http" && !isThisMachine(url.part(CURLUPART_HOST)) &&
      !values.boolean("AllowPlainHTTP").value_or(false)) {
    return wrong(file, "the password would travel unencrypted; use https:, or set \"AllowPlainHTTP\" to true");
  }
  return settings;
}

}  // namespace storix::example
