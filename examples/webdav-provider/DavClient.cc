#include "examples/webdav-provider/DavClient.h"

#include <curl/curl.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <condition_variable>
#include <mutex>
#include <utility>

#include "examples/webdav-provider/ContentHash.h"
#include "examples/webdav-provider/DavPath.h"

namespace storix::example {

namespace {

constexpr const char *propertiesWanted =
    R"(<?xml version="1.0" encoding="utf-8"?><propfind xmlns="DAV:"><prop><resourcetype/><getcontentlength/>)"
    R"(<getetag/><getlastmodified/></prop></propfind>)";

/// In all, for one document, however far each of them came.
constexpr int downloadAttemptsAtMost = 1000;

bool isStrong(std::string_view etag) { return etag.starts_with('"'); }

bool isPassing(long status) {
  return status == 408 || status == 429 || (status >= 500 && status != 501 && status != 507);
}

/// The first byte of "bytes 5-9/10" and the length of the whole, where it is said.
struct ContentRange {
  std::int64_t first = -1;
  std::optional<std::int64_t> total;
};

ContentRange contentRange(std::string_view text) {
  ContentRange range;
  if (!text.starts_with("bytes ")) return range;
  text.remove_prefix(6);
  std::from_chars(text.data(), text.data() + text.size(), range.first);
  if (const std::size_t slash = text.find('/'); slash != std::string_view::npos) {
    std::int64_t total = 0;
    const auto [end, error] = std::from_chars(text.data() + slash + 1, text.data() + text.size(), total);
    if (error == std::errc() && end == text.data() + text.size()) range.total = total;
  }
  return range;
}

/// Puts the content of one answer into the file, where it belongs.
class DownloadSink {
 public:
  explicit DownloadSink(PartialDownload &partial) : partial_(partial) {}

  std::optional<SXError> take(const HttpResponse &response, std::string_view bytes) {
    if (!begun_) {
      begun_ = true;
      if (auto failed = begin(response)) return failed;
    }
    while (!bytes.empty()) {
      const ssize_t count = ::pwrite(partial_.file, bytes.data(), bytes.size(), partial_.length);
      if (count < 0 && errno == EINTR) continue;
      if (count < 0) return posixError(errno, "writing down a download");
      partial_.length += count;
      bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    if (partial_.grown) partial_.grown(partial_.length);
    return std::nullopt;
  }

  /// The length that the server has announced for the whole document.
  [[nodiscard]] std::optional<std::int64_t> total() const { return total_; }

 private:
  std::optional<SXError> begin(const HttpResponse &response) {
    const std::string_view encoding = response.header("content-encoding");
    if (!encoding.empty() && encoding != "identity") {
      return posixError(EPROTO, "downloading (the server sent it in the encoding " + std::string(encoding) +
                                    ", which was not asked for)");
    }
    if (response.status == 206) {
      const ContentRange range = contentRange(response.header("content-range"));
      if (range.first != partial_.length || response.header("etag") != partial_.etag) {
        return posixError(EPROTO, "downloading (the server sent another part than it was asked for)");
      }
      total_ = range.total;
      return std::nullopt;
    }
    partial_.length = 0;
    partial_.etag = response.header("etag");
    if (::ftruncate(partial_.file, 0) != 0) return posixError(errno, "writing down a download");
    std::int64_t length = 0;
    const std::string_view text = response.header("content-length");
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), length);
    if (!text.empty() && error == std::errc() && end == text.data() + text.size()) total_ = length;
    return std::nullopt;
  }

  PartialDownload &partial_;
  std::optional<std::int64_t> total_;
  bool begun_ = false;
};

Downloaded downloadedFrom(const HttpResponse &response, bool isUnchanged) {
  Downloaded downloaded;
  downloaded.isUnchanged = isUnchanged;
  downloaded.etag = response.header("etag");
  if (const std::string text(response.header("last-modified")); !text.empty()) {
    const time_t time = ::curl_getdate(text.c_str(), nullptr);
    if (time >= 0) downloaded.modificationTime = time;
  }
  return downloaded;
}

}  // namespace

DavClient::DavClient(DavSettings settings) : settings_(std::move(settings)), connections_(settings_.http) {}

std::string DavClient::onlyOver(const DavEntry &version) {
  if (isStrong(version.etag)) return "If-Match: " + version.etag;
  if (!version.modificationTime) return {};
  tm parts{};
  ::gmtime_r(&*version.modificationTime, &parts);
  char text[64];
  // The C locale's names of days and months: a program that sets none has that one.
  const std::size_t length = std::strftime(text, sizeof text, "%a, %d %b %Y %H:%M:%S GMT", &parts);
  return "If-Unmodified-Since: " + std::string(text, length);
}

void DavClient::pause(std::chrono::milliseconds duration, const std::stop_token &cancellation) {
  std::mutex mutex;
  std::condition_variable_any stopped;
  std::unique_lock lock(mutex);
  stopped.wait_for(lock, cancellation, duration, [] { return false; });
}

Result<std::vector<DavEntry>> DavClient::list(const std::string &path, const std::stop_token &cancellation) {
  auto entries = find(path, "1", cancellation);
  if (entries) std::erase_if(entries.value(), [](const DavEntry &entry) { return entry.path.empty(); });
  return entries;
}

Result<std::optional<DavEntry>> DavClient::entry(const std::string &path, const std::stop_token &cancellation) {
  auto entries = find(path, "0", cancellation);
  if (!entries) {
    if (entries.error().code() == ENOENT) return std::optional<DavEntry>();
    return entries.error();
  }
  for (DavEntry &entry : entries.value()) {
    if (entry.path.empty()) return std::optional(std::move(entry));
  }
  return posixError(EPROTO, "asking the server about " + urlOf(path) + " (its answer is about something else)");
}

Result<std::vector<DavEntry>> DavClient::find(const std::string &path, const char *depth,
                                              const std::stop_token &cancellation) {
  HttpRequest request;
  request.method = "PROPFIND";
  request.url = urlOf(path);
  request.headers = {"Depth: " + std::string(depth), "Content-Type: application/xml; charset=utf-8"};
  request.body = propertiesWanted;
  auto response = perform(request, cancellation);
  if (!response) return response.error();
  if (response.value().status != 207) return statusError(response.value(), request);
  const auto requestPath = decodedPathOfReference(request.url);
  if (!requestPath) return posixError(EINVAL, "asking the server about " + request.url);
  return readMultistatus(response.value().body, *requestPath);
}

Result<Downloaded> DavClient::download(const std::string &path, const std::string &knownETag, PartialDownload &partial,
                                       const std::stop_token &cancellation) {
  int failures = 0;
  for (int attempt = 1;; ++attempt) {
    HttpRequest request;
    request.method = "GET";
    request.url = urlOf(path);
    const bool resuming = partial.length > 0 && isStrong(partial.etag);
    if (resuming) {
      request.headers.push_back("Range: bytes=" + std::to_string(partial.length) + "-");
      request.headers.push_back("If-Range: " + partial.etag);
    } else if (!knownETag.empty()) {
      request.headers.push_back("If-None-Match: " + knownETag);
    }
    DownloadSink sink(partial);
    request.received = [&sink](const HttpResponse &response, std::string_view bytes) {
      return sink.take(response, bytes);
    };
    const std::int64_t before = partial.length;
    const Answer answer = performOnce(request, cancellation);
    const HttpResponse &response = answer.response;
    if (!answer.failure && (response.status == 200 || response.status == 206)) {
      if (!sink.total() || *sink.total() == partial.length) return downloadedFrom(response, false);
    } else if (!answer.failure && response.status == 304 && !knownETag.empty() && !resuming) {
      return downloadedFrom(response, true);
    } else if (!answer.failure && response.status == 416 && resuming) {
      // What is there is as long as the whole, or longer: it is not to be trusted.
      partial.length = 0;
      partial.etag.clear();
    } else if (answer.failure ? !answer.failure->worthRetrying : !isPassing(response.status)) {
      return answer.failure ? answer.failure->error : statusError(response, request);
    }
    // Who came further may try on.
    if (partial.length > before) failures = 0;
    if (attempt >= downloadAttemptsAtMost || !mayTryAgain(failures, cancellation)) {
      if (cancellation.stop_requested()) return posixError(ECANCELED, "downloading " + request.url);
      if (answer.failure) return answer.failure->error;
      return isPassing(response.status)
                 ? statusError(response, request)
                 : posixError(EPROTO, "downloading " + request.url + " (what arrived has not the announced length)");
    }
  }
}

Result<Uploaded> DavClient::upload(const std::string &path, int file, std::int64_t size, const std::string &condition,
                                   const std::stop_token &cancellation) {
  ContentHash hash;
  HttpRequest request;
  request.method = "PUT";
  request.url = urlOf(path);
  request.headers = {"Content-Type: application/octet-stream"};
  if (!condition.empty()) request.headers.push_back(condition);
  request.file.emplace(file, size);
  request.sent = [&hash](std::string_view bytes) {
    if (bytes.empty()) {
      hash.reset();
    } else {
      hash.add(bytes);
    }
  };
  bool madeCollections = false;
  for (;;) {
    auto response = perform(request, cancellation);
    if (!response) return response.error();
    const long status = response.value().status;
    if (status == 412) return Uploaded{true, "", ""};
    if (status >= 200 && status < 300)
      return Uploaded{false, std::string(response.value().header("etag")), hash.finish()};
    if ((status != 409 && status != 404) || madeCollections) return statusError(response.value(), request);
    madeCollections = true;
    if (auto failed = makeCollectionsAbove(path, cancellation)) return *failed;
  }
}

std::optional<SXError> DavClient::makeCollectionsAbove(const std::string &path, const std::stop_token &cancellation) {
  for (std::size_t slash = path.find('/'); slash != std::string::npos; slash = path.find('/', slash + 1)) {
    HttpRequest request;
    request.method = "MKCOL";
    request.url = urlOf(path.substr(0, slash)) + "/";
    auto response = perform(request, cancellation);
    if (!response) return response.error();
    const long status = response.value().status;
    // 405: there is one already.
    if (status != 405 && (status < 200 || status >= 300)) return statusError(response.value(), request);
  }
  return std::nullopt;
}

std::string DavClient::urlOf(const std::string &path) const { return settings_.url + percentEncodedPath(path); }

Result<HttpResponse> DavClient::perform(const HttpRequest &request, const std::stop_token &cancellation) {
  for (int failures = 0;;) {
    Answer answer = performOnce(request, cancellation);
    const bool mayPass = answer.failure ? answer.failure->worthRetrying : isPassing(answer.response.status);
    if (mayPass && mayTryAgain(failures, cancellation)) continue;
    if (answer.failure) return answer.failure->error;
    return std::move(answer.response);
  }
}

DavClient::Answer DavClient::performOnce(const HttpRequest &request, const std::stop_token &cancellation) {
  auto outcome = connections_.perform(request, cancellation);
  if (auto *failure = std::get_if<HttpFailure>(&outcome)) return {std::move(*failure), {}};
  return {std::nullopt, std::move(std::get<HttpResponse>(outcome))};
}

bool DavClient::mayTryAgain(int &failures, const std::stop_token &cancellation) const {
  if (++failures >= settings_.attempts || cancellation.stop_requested()) return false;
  pause(settings_.retryDelay * (1 << std::min(failures - 1, 10)), cancellation);
  return !cancellation.stop_requested();
}

SXError DavClient::statusError(const HttpResponse &response, const HttpRequest &request) const {
  const auto error = [&](int number, const std::string &sentence) {
    return posixError(number, request.method + " " + request.url + ": " + sentence + " (status " +
                                  std::to_string(response.status) + ")");
  };
  switch (response.status) {
    case 401:
      return settings_.http.credentials
                 ? error(EACCES, "the server refused the name or password in " + settings_.credentialsFile)
                 : error(EACCES, "the server wants a name and password; put them into " + settings_.credentialsFile);
    case 403:
      return error(EACCES, "the server does not allow that to the name in " + settings_.credentialsFile);
    case 404:
    case 410:
      return error(ENOENT, "the server has nothing there");
    case 405:
    case 501:
      return error(ENOTSUP, "the server does not do that there; is it a WebDAV folder?");
    case 409:
      return error(ENOENT, "the server has no folder for it");
    case 412:
      return error(EAGAIN, "the server has another version");
    case 413:
      return error(EFBIG, "the server takes no document of that size");
    case 423:
      return error(EBUSY, "somebody has locked it on the server");
    case 507:
      return error(ENOSPC, "the server has no room left");
    default:
      break;
  }
  if (response.status >= 300 && response.status < 400) {
    return error(EREMCHG, "the server says that it is elsewhere; put its address into the configuration");
  }
  if (response.status >= 500) return error(EREMOTEIO, "the server failed; try again later");
  return error(EPROTO, "the server gave an answer that WebDAV does not have");
}

}  // namespace storix::example
