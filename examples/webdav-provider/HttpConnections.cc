#include "examples/webdav-provider/HttpConnections.h"

#include <curl/curl.h>
#include <unistd.h>

#include <array>
#include <cctype>
#include <cerrno>
#include <cstdio>
#include <utility>

#include "examples/webdav-provider/DavPath.h"

namespace storix::example {

namespace {

constexpr std::size_t bodyAtMost = std::size_t{64} << 20;
constexpr std::size_t idleAtMost = 8;
constexpr long redirectionsAtMost = 5;

/// Once in a process, before any other thread can use the library.
void initializeLibrary() {
  static const CURLcode done = ::curl_global_init(CURL_GLOBAL_DEFAULT);
  static_cast<void>(done);
}

std::string smallLetters(std::string_view text) {
  std::string small(text);
  for (char &c : small) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return small;
}

/// What one request does while the library runs it.
struct Exchange {
  const HttpRequest &request;
  CURL *easy;
  HttpResponse response;
  std::optional<SXError> failure;
  std::int64_t sentBytes = 0;
  bool receivedAnything = false;

  [[nodiscard]] bool hasContent() const {
    return request.received && (response.status == 200 || response.status == 206);
  }

  bool receive(std::string_view bytes) {
    if (hasContent()) {
      receivedAnything = true;
      failure = request.received(response, bytes);
    } else if (response.body.size() + bytes.size() > bodyAtMost) {
      failure = posixError(EFBIG, "reading what the server answered");
    } else {
      response.body += bytes;
    }
    return !failure;
  }

  static std::size_t write(char *bytes, std::size_t /*one*/, std::size_t count, void *data) {
    return static_cast<Exchange *>(data)->receive({bytes, count}) ? count : 0;
  }

  static std::size_t header(char *bytes, std::size_t /*one*/, std::size_t count, void *data) {
    auto &response = static_cast<Exchange *>(data)->response;
    const std::string_view line(bytes, count);
    if (line.starts_with("HTTP/")) {
      response.headers.clear();
      ::curl_easy_getinfo(static_cast<Exchange *>(data)->easy, CURLINFO_RESPONSE_CODE, &response.status);
    } else if (const std::size_t colon = line.find(':'); colon != std::string_view::npos) {
      response.headers[smallLetters(line.substr(0, colon))] = trimmed(line.substr(colon + 1));
    }
    return count;
  }

  static std::size_t read(char *buffer, std::size_t /*one*/, std::size_t count, void *data) {
    auto &self = *static_cast<Exchange *>(data);
    const auto left = static_cast<std::size_t>(self.request.file->second - self.sentBytes);
    ssize_t bytes = 0;
    do {
      bytes = ::pread(self.request.file->first, buffer, std::min(count, left), self.sentBytes);
    } while (bytes < 0 && errno == EINTR);
    if (bytes < 0 || (bytes == 0 && left > 0)) {
      self.failure = bytes < 0 ? posixError(errno, "reading the document that is sent")
                               : posixError(EAGAIN, "reading the document that is sent (it became shorter meanwhile)");
      return CURL_READFUNC_ABORT;
    }
    self.sentBytes += bytes;
    if (bytes > 0 && self.request.sent) self.request.sent({buffer, static_cast<std::size_t>(bytes)});
    return static_cast<std::size_t>(bytes);
  }

  static int rewind(void *data, curl_off_t offset, int origin) {
    auto &self = *static_cast<Exchange *>(data);
    if (origin != SEEK_SET || offset != 0) return CURL_SEEKFUNC_CANTSEEK;
    self.sentBytes = 0;
    if (self.request.sent) self.request.sent({});
    return CURL_SEEKFUNC_OK;
  }
};

HttpFailure failureFrom(CURLcode code, const std::string &words, const HttpRequest &request) {
  const std::string doing = "asking the server (" + request.method + " " + request.url + ", " +
                            (words.empty() ? ::curl_easy_strerror(code) : words) + ")";
  switch (code) {
    case CURLE_COULDNT_RESOLVE_HOST:
      return {posixError(EHOSTUNREACH, doing), true};
    case CURLE_COULDNT_CONNECT:
      return {posixError(ECONNREFUSED, doing), true};
    case CURLE_OPERATION_TIMEDOUT:
      return {posixError(ETIMEDOUT, doing), true};
    case CURLE_PARTIAL_FILE:
    case CURLE_GOT_NOTHING:
    case CURLE_SEND_ERROR:
    case CURLE_RECV_ERROR:
    case CURLE_HTTP2:
    case CURLE_HTTP2_STREAM:
    case CURLE_SSL_CONNECT_ERROR:
      return {posixError(ECONNRESET, doing), true};
    case CURLE_OUT_OF_MEMORY:
      return {posixError(ENOMEM, doing), false};
    default:
      return {posixError(EPROTO, doing), false};
  }
}

}  // namespace

std::string_view HttpResponse::header(std::string_view name) const {
  const auto found = headers.find(name);
  return found == headers.end() ? std::string_view() : std::string_view(found->second);
}

/// One of the library's handles with the connections that it has opened. One thread at a time.
class HttpConnections::Connection {
 public:
  Connection() : multi_(::curl_multi_init(), &::curl_multi_cleanup), easy_(::curl_easy_init(), &::curl_easy_cleanup) {}

  std::variant<HttpResponse, HttpFailure> perform(const HttpSettings &settings, const HttpRequest &request,
                                                  const std::stop_token &cancellation) {
    if (!multi_ || !easy_) return HttpFailure{posixError(ENOMEM, "asking the server"), false};
    Exchange exchange{request, easy_.get(), {}, {}, 0, false};
    std::array<char, CURL_ERROR_SIZE> words{};
    Headers headers = setUp(settings, request, exchange, words.data());
    const CURLcode code = run(cancellation);
    if (cancellation.stop_requested()) return HttpFailure{posixError(ECANCELED, "asking the server"), false};
    if (code == CURLE_OK && exchange.hasContent() && !exchange.receivedAnything) exchange.receive({});
    if (exchange.failure) return HttpFailure{*exchange.failure, false};
    // A server may answer before it has read everything, and close: its answer counts.
    const bool answeredEarly = code == CURLE_SEND_ERROR && exchange.response.status >= 300;
    if (code != CURLE_OK && !answeredEarly) return failureFrom(code, words.data(), request);
    return std::move(exchange.response);
  }

 private:
  using Headers = std::unique_ptr<curl_slist, decltype(&::curl_slist_free_all)>;

  template <class... Value>
  void set(CURLoption option, Value... value) {
    ::curl_easy_setopt(easy_.get(), option, value...);
  }

  Headers setUp(const HttpSettings &settings, const HttpRequest &request, Exchange &exchange, char *words) {
    ::curl_easy_reset(easy_.get());
    const char *redirections = settings.mayUsePlainHttp ? "http,https" : "https";
    set(CURLOPT_URL, request.url.c_str());
    set(CURLOPT_PROTOCOLS_STR, "http,https");
    set(CURLOPT_REDIR_PROTOCOLS_STR, redirections);
    set(CURLOPT_FOLLOWLOCATION, request.method == "GET" || request.method == "PROPFIND" ? 1L : 0L);
    set(CURLOPT_MAXREDIRS, redirectionsAtMost);
    set(CURLOPT_POSTREDIR, static_cast<long>(CURL_REDIR_POST_ALL));
    set(CURLOPT_UNRESTRICTED_AUTH, 0L);
    set(CURLOPT_SSL_VERIFYPEER, 1L);
    set(CURLOPT_SSL_VERIFYHOST, 2L);
    set(CURLOPT_PROXY, "");
    set(CURLOPT_NOSIGNAL, 1L);
    set(CURLOPT_ERRORBUFFER, words);
    set(CURLOPT_CONNECTTIMEOUT, static_cast<long>(settings.connectTimeout.count()));
    set(CURLOPT_LOW_SPEED_LIMIT, 1L);
    set(CURLOPT_LOW_SPEED_TIME, static_cast<long>(settings.stallTimeout.count()));
    if (settings.credentials) {
      set(CURLOPT_HTTPAUTH, static_cast<long>(CURLAUTH_BASIC));
      set(CURLOPT_USERNAME, settings.credentials->name.c_str());
      set(CURLOPT_PASSWORD, settings.credentials->password.c_str());
    }
    set(CURLOPT_WRITEFUNCTION, &Exchange::write);
    set(CURLOPT_WRITEDATA, &exchange);
    set(CURLOPT_HEADERFUNCTION, &Exchange::header);
    set(CURLOPT_HEADERDATA, &exchange);
    if (request.file) {
      set(CURLOPT_UPLOAD, 1L);
      set(CURLOPT_INFILESIZE_LARGE, static_cast<curl_off_t>(request.file->second));
      set(CURLOPT_READFUNCTION, &Exchange::read);
      set(CURLOPT_READDATA, &exchange);
      set(CURLOPT_SEEKFUNCTION, &Exchange::rewind);
      set(CURLOPT_SEEKDATA, &exchange);
      if (request.sent) request.sent({});
    } else if (!request.body.empty()) {
      set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.body.size()));
      set(CURLOPT_POSTFIELDS, request.body.c_str());
    }
    if (request.method != "GET" && !request.file) set(CURLOPT_CUSTOMREQUEST, request.method.c_str());
    Headers headers(nullptr, &::curl_slist_free_all);
    for (const std::string &line : request.headers) {
      if (curl_slist *longer = ::curl_slist_append(headers.get(), line.c_str())) {
        static_cast<void>(headers.release());
        headers.reset(longer);
      }
    }
    set(CURLOPT_HTTPHEADER, headers.get());
    return headers;
  }

  CURLcode run(const std::stop_token &cancellation) {
    CURLM *multi = multi_.get();
    const std::stop_callback wake(cancellation, [multi] { ::curl_multi_wakeup(multi); });
    ::curl_multi_add_handle(multi, easy_.get());
    CURLcode result = CURLE_OK;
    for (int running = 1; running > 0 && !cancellation.stop_requested();) {
      if (::curl_multi_perform(multi, &running) != CURLM_OK) {
        result = CURLE_FAILED_INIT;
        break;
      }
      if (running > 0) ::curl_multi_poll(multi, nullptr, 0, 1000, nullptr);
    }
    int left = 0;
    while (const CURLMsg *message = ::curl_multi_info_read(multi, &left)) {
      if (message->msg == CURLMSG_DONE) result = message->data.result;
    }
    ::curl_multi_remove_handle(multi, easy_.get());
    return result;
  }

  std::unique_ptr<CURLM, decltype(&::curl_multi_cleanup)> multi_;
  std::unique_ptr<CURL, decltype(&::curl_easy_cleanup)> easy_;
};

HttpConnections::HttpConnections(HttpSettings settings) : settings_(std::move(settings)) { initializeLibrary(); }

HttpConnections::~HttpConnections() = default;

std::variant<HttpResponse, HttpFailure> HttpConnections::perform(const HttpRequest &request,
                                                                 const std::stop_token &cancellation) {
  std::unique_ptr<Connection> connection = take();
  auto outcome = connection->perform(settings_, request, cancellation);
  giveBack(std::move(connection));
  return outcome;
}

std::unique_ptr<HttpConnections::Connection> HttpConnections::take() {
  const std::lock_guard lock(mutex_);
  if (idle_.empty()) return std::make_unique<Connection>();
  std::unique_ptr<Connection> connection = std::move(idle_.back());
  idle_.pop_back();
  return connection;
}

void HttpConnections::giveBack(std::unique_ptr<Connection> connection) {
  const std::lock_guard lock(mutex_);
  if (idle_.size() < idleAtMost) idle_.push_back(std::move(connection));
}

}  // namespace storix::example
