#pragma once

#include <chrono>
#include <cstdint>
#include <ctime>
#include <functional>
#include <optional>
#include <stop_token>
#include <string>
#include <vector>

#include "examples/webdav-provider/DavListing.h"
#include "examples/webdav-provider/HttpConnections.h"
#include "platform/Result.h"

namespace storix::example {

struct DavSettings {
  /// The collection that is served, ending in "/", without name and password.
  std::string url;
  HttpSettings http;
  /// For the sentence about a refused password.
  std::string credentialsFile;
  /// How often in a row something may fail for a reason that can pass, and how long to wait before the
  /// second time; the wait doubles.
  int attempts = 5;
  std::chrono::milliseconds retryDelay{500};
  /// How often it is told how far a download is.
  std::chrono::milliseconds progressInterval{500};
};

/// A download that has begun, in a file that nobody else uses. What is there of it is good: after a
/// failure it can be kept, and later the download goes on.
struct PartialDownload {
  int file = -1;
  /// Of the version whose first bytes are there; empty where there are none.
  std::string etag;
  std::int64_t length = 0;
  /// Hears of the length as it grows; may be empty.
  std::function<void(std::int64_t)> grown;
};

struct Downloaded {
  /// The server's version is the known one, and nothing was downloaded.
  bool isUnchanged = false;
  std::string etag;
  std::optional<time_t> modificationTime;
};

struct Uploaded {
  /// The server has another version than the condition says, and took nothing.
  bool preconditionFailed = false;
  /// Empty where the server does not say.
  std::string etag;
  /// ContentHash of what was sent.
  std::string hash;
};

/// The requests of WebDAV, about documents that are known by their path relative to the served
/// collection. Each is made again, a bounded number of times, where it failed for a reason that can
/// pass; a download goes on where it was broken off. Thread-safe; blocks its caller, until the token is
/// stopped (ECANCELED). Errors are of the domain "posix" with a sentence that says what the server
/// answered: ENOENT, EACCES (name or password refused, or not allowed), ENOSPC, ETIMEDOUT, ...
class DavClient {
 public:
  explicit DavClient(DavSettings settings);

  [[nodiscard]] const DavSettings &settings() const { return settings_; }

  /// What is in the collection, without itself.
  Result<std::vector<DavEntry>> list(const std::string &path, const std::stop_token &cancellation);

  /// Absent when the server has nothing there.
  Result<std::optional<DavEntry>> entry(const std::string &path, const std::stop_token &cancellation);

  /// Downloads what is at the path, unless that is the version of `knownETag` (empty: none is known).
  Result<Downloaded> download(const std::string &path, const std::string &knownETag, PartialDownload &partial,
                              const std::stop_token &cancellation);

  /// Sends the first `size` bytes of the file, under the condition of one of the functions below. Makes
  /// the collections above where the server says that they are missing.
  Result<Uploaded> upload(const std::string &path, int file, std::int64_t size, const std::string &condition,
                          const std::stop_token &cancellation);

  static std::string onlyWhereNothingIs() { return "If-None-Match: *"; }
  static std::string onlyOver(const DavEntry &version);

  /// Waits, or not to the end when the token is stopped.
  static void pause(std::chrono::milliseconds duration, const std::stop_token &cancellation);

 private:
  struct Answer {
    std::optional<HttpFailure> failure;
    HttpResponse response;
  };

  [[nodiscard]] std::string urlOf(const std::string &path) const;
  [[nodiscard]] SXError statusError(const HttpResponse &response, const HttpRequest &request) const;
  Result<std::vector<DavEntry>> find(const std::string &path, const char *depth, const std::stop_token &cancellation);
  std::optional<SXError> makeCollectionsAbove(const std::string &path, const std::stop_token &cancellation);
  /// One request, made again where that may help.
  Result<HttpResponse> perform(const HttpRequest &request, const std::stop_token &cancellation);
  Answer performOnce(const HttpRequest &request, const std::stop_token &cancellation);
  /// False when the attempts are used up, or the token is stopped.
  bool mayTryAgain(int &failures, const std::stop_token &cancellation) const;

  const DavSettings settings_;
  HttpConnections connections_;
};

}  // namespace storix::example
