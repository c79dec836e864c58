#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <stop_token>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/SXError.h"

namespace storix::example {

struct HttpCredentials {
  std::string name;
  std::string password;
};

struct HttpSettings {
  std::optional<HttpCredentials> credentials;
  /// Whether a redirection may lead to "http:". Nothing but http and https is spoken at all.
  bool mayUsePlainHttp = false;
  std::chrono::seconds connectTimeout{20};
  /// How long nothing may move before a server counts as stuck.
  std::chrono::seconds stallTimeout{60};
};

struct HttpResponse {
  long status = 0;
  /// The names in small letters.
  std::map<std::string, std::string, std::less<>> headers;
  std::string body;

  /// Empty where there is none.
  [[nodiscard]] std::string_view header(std::string_view name) const;
};

struct HttpRequest {
  std::string method;
  std::string url;
  std::vector<std::string> headers;
  std::string body;
  /// The content to send in the place of `body`: a file that is read from its beginning.
  std::optional<std::pair<int, std::int64_t>> file;
  /// Hears of the file's bytes as they are sent; and of an empty text when sending begins (again).
  std::function<void(std::string_view)> sent;
  /// Takes the content of an answer 200 or 206 in the place of `body`; called at least once for such
  /// an answer. An error ends the request with that error.
  std::function<std::optional<SXError>(const HttpResponse &, std::string_view)> received;
};

/// Why there was no answer, or no whole one.
struct HttpFailure {
  SXError error;
  bool worthRetrying = false;
};

/// Makes HTTP requests to one server and keeps its connections for the next ones. Certificates are
/// verified. Answers that lead elsewhere are followed for GET and PROPFIND, and the name and password
/// never go along to another host. Thread-safe; each request occupies its caller's thread, and is
/// broken off (ECANCELED) at once when the token is stopped.
class HttpConnections {
 public:
  explicit HttpConnections(HttpSettings settings);
  ~HttpConnections();
  HttpConnections(const HttpConnections &) = delete;
  HttpConnections &operator=(const HttpConnections &) = delete;

  std::variant<HttpResponse, HttpFailure> perform(const HttpRequest &request, const std::stop_token &cancellation);

 private:
  class Connection;

  std::unique_ptr<Connection> take();
  void giveBack(std::unique_ptr<Connection> connection);

  const HttpSettings settings_;
  std::mutex mutex_;
  std::vector<std::unique_ptr<Connection>> idle_;  ///< Under the mutex.
};

}  // namespace storix::example
