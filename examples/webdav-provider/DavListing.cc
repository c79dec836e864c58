#include "examples/webdav-provider/DavListing.h"

#include <curl/curl.h>
#include <expat.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <memory>
#include <type_traits>
#include <utility>

#include "examples/webdav-provider/DavPath.h"

namespace storix::example {

namespace {

constexpr char namespaceSeparator = '\n';
constexpr std::size_t entriesAtMost = 100'000;
constexpr std::size_t depthAtMost = 64;

struct Properties {
  bool isCollection = false;
  std::string size;
  std::string etag;
  std::string modificationTime;
};

struct Response {
  std::vector<std::string> references;
  std::string status;
  Properties properties;
};

bool isSuccess(std::string_view statusLine) {
  statusLine = trimmed(statusLine);
  const std::size_t space = statusLine.find(' ');
  return space != std::string_view::npos && statusLine.size() > space + 3 && statusLine[space + 1] == '2';
}

/// Follows the elements of one document, and stops the parser at what is refused.
class MultistatusParser {
 public:
  MultistatusParser() : parser_(XML_ParserCreateNS(nullptr, namespaceSeparator), &XML_ParserFree) {
    if (!parser_) return;
    XML_SetUserData(parser_.get(), this);
    XML_SetElementHandler(parser_.get(), &began, &ended);
    XML_SetCharacterDataHandler(parser_.get(), &text);
    XML_SetStartDoctypeDeclHandler(parser_.get(), &documentType);
  }

  Result<std::vector<Response>> parse(std::string_view document) {
    constexpr std::size_t step = std::size_t{1} << 20;
    if (!parser_) return posixError(ENOMEM, "reading the server's list");
    for (std::size_t begin = 0; begin == 0 || begin < document.size(); begin += step) {
      const std::string_view part = document.substr(begin, step);
      const bool last = begin + step >= document.size();
      if (XML_Parse(parser_.get(), part.data(), static_cast<int>(part.size()), last ? 1 : 0) != XML_STATUS_OK) {
        return refused(reason_.empty() ? XML_ErrorString(XML_GetErrorCode(parser_.get())) : reason_);
      }
    }
    if (!isMultistatus_) return refused("it is no DAV multistatus");
    return std::move(responses_);
  }

 private:
  static MultistatusParser &self(void *data) { return *static_cast<MultistatusParser *>(data); }

  static void XMLCALL began(void *data, const XML_Char *name, const XML_Char ** /*attributes*/) {
    self(data).begin(name);
  }
  static void XMLCALL ended(void *data, const XML_Char * /*name*/) { self(data).end(); }
  static void XMLCALL text(void *data, const XML_Char *characters, int count) {
    self(data).text_.append(characters, static_cast<std::size_t>(count));
  }
  static void XMLCALL documentType(void *data, const XML_Char * /*name*/, const XML_Char * /*system*/,
                                   const XML_Char * /*publicID*/, int /*hasSubset*/) {
    self(data).stop("it holds a document type, which no server needs");
  }

  void begin(std::string_view name) {
    if (path_.size() >= depthAtMost) return stop("it is nested too deep");
    path_.emplace_back(name.starts_with("DAV:\n") ? name.substr(5) : std::string_view());
    text_.clear();
    if (isAt({"multistatus"})) isMultistatus_ = true;
    if (isAt({"multistatus", "response"})) {
      if (responses_.size() >= entriesAtMost) return stop("it has too many entries");
      responses_.emplace_back();
    }
    if (isAt({"multistatus", "response", "propstat"})) {
      found_ = {};
      foundStatus_.clear();
    }
  }

  void end() {
    if (isAt({"multistatus", "response", "href"})) {
      responses_.back().references.push_back(text_);
    } else if (isAt({"multistatus", "response", "status"})) {
      responses_.back().status = text_;
    } else if (isAt({"multistatus", "response", "propstat", "status"})) {
      foundStatus_ = text_;
    } else if (isAt({"multistatus", "response", "propstat"})) {
      if (isSuccess(foundStatus_)) take();
    } else if (isAt({"multistatus", "response", "propstat", "prop", "getcontentlength"})) {
      found_.size = trimmed(text_);
    } else if (isAt({"multistatus", "response", "propstat", "prop", "getetag"})) {
      found_.etag = trimmed(text_);
    } else if (isAt({"multistatus", "response", "propstat", "prop", "getlastmodified"})) {
      found_.modificationTime = trimmed(text_);
    } else if (isAt({"multistatus", "response", "propstat", "prop", "resourcetype", "collection"})) {
      found_.isCollection = true;
    }
    path_.pop_back();
    text_.clear();
  }

  void take() {
    Properties &all = responses_.back().properties;
    all.isCollection = all.isCollection || found_.isCollection;
    if (!found_.size.empty()) all.size = std::move(found_.size);
    if (!found_.etag.empty()) all.etag = std::move(found_.etag);
    if (!found_.modificationTime.empty()) all.modificationTime = std::move(found_.modificationTime);
  }

  [[nodiscard]] bool isAt(std::initializer_list<std::string_view> names) const {
    return std::equal(path_.begin(), path_.end(), names.begin(), names.end());
  }

  void stop(std::string reason) {
    reason_ = std::move(reason);
    XML_StopParser(parser_.get(), XML_FALSE);
  }

  [[nodiscard]] SXError refused(const std::string &why) const {
    return posixError(EPROTO, "reading the server's list, line " +
                                  std::to_string(XML_GetCurrentLineNumber(parser_.get())) + ": " + why);
  }

  std::unique_ptr<std::remove_pointer_t<XML_Parser>, decltype(&XML_ParserFree)> parser_;
  std::vector<std::string> path_;  ///< Local names; empty for elements that are not DAV's.
  std::string text_;
  Properties found_;
  std::string foundStatus_;
  std::vector<Response> responses_;
  bool isMultistatus_ = false;
  std::string reason_;
};

/// The path below `base`: empty for that itself, none outside.
std::optional<std::string> below(const std::string &base, const std::string &path) {
  if (path == base) return "";
  const std::string directory = base == "/" ? base : base + "/";
  if (!path.starts_with(directory)) return std::nullopt;
  return path.substr(directory.size());
}

/// What stands for the request among the references.
std::string basePath(const std::vector<std::pair<std::string, DavEntry>> &found, const std::string &requestPath) {
  if (found.empty()) return requestPath;
  const std::string *shortest = &found.front().first;
  for (const auto &[path, entry] : found) {
    if (below(requestPath, path)) return requestPath;
    if (path.size() < shortest->size()) shortest = &path;
  }
  const bool holdsAll = std::all_of(found.begin(), found.end(),
                                    [shortest](const auto &one) { return below(*shortest, one.first).has_value(); });
  return holdsAll ? *shortest : requestPath;
}

DavEntry entryFrom(const Properties &properties) {
  DavEntry entry;
  entry.isCollection = properties.isCollection;
  // It goes into headers and into files: what is no plain text there counts as none.
  const bool isPlain =
      std::all_of(properties.etag.begin(), properties.etag.end(), [](char c) { return c >= ' ' && c <= '~'; });
  if (isPlain) entry.etag = properties.etag;
  std::int64_t size = 0;
  const char *end = properties.size.data() + properties.size.size();
  if (const auto [rest, error] = std::from_chars(properties.size.data(), end, size);
      error == std::errc() && rest == end && size >= 0) {
    entry.size = size;
  }
  if (!properties.modificationTime.empty()) {
    const time_t time = ::curl_getdate(properties.modificationTime.c_str(), nullptr);
    if (time >= 0) entry.modificationTime = time;
  }
  return entry;
}

}  // namespace

std::string_view withoutWeakness(std::string_view etag) {
  if (etag.starts_with("W/")) etag.remove_prefix(2);
  return etag;
}

std::string DavEntry::version() const {
  if (!etag.empty()) return std::string(withoutWeakness(etag));
  if (!size && !modificationTime) return "";
  return "size " + std::to_string(size.value_or(-1)) + " time " + std::to_string(modificationTime.value_or(-1));
}

Result<std::vector<DavEntry>> readMultistatus(std::string_view text, const std::string &requestPath) {
  auto responses = MultistatusParser().parse(text);
  if (!responses) return responses.error();
  std::vector<std::pair<std::string, DavEntry>> found;
  for (const Response &response : responses.value()) {
    if (!response.status.empty() && !isSuccess(response.status)) continue;
    for (const std::string &reference : response.references) {
      if (auto path = decodedPathOfReference(reference)) {
        found.emplace_back(*std::move(path), entryFrom(response.properties));
      }
    }
  }
  const std::string base = basePath(found, requestPath);
  std::vector<DavEntry> entries;
  for (auto &[path, entry] : found) {
    if (auto relative = below(base, path)) {
      entry.path = *std::move(relative);
      entries.push_back(std::move(entry));
    }
  }
  return entries;
}

}  // namespace storix::example
