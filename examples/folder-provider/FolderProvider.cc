#include "FolderProvider.h"

#include <fcntl.h>
#include <rapidjson/document.h>
#include <rapidjson/error/en.h>
#include <rapidjson/pointer.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <iterator>
#include <utility>

namespace storix::example {

namespace {

SXError noSource(const std::string &file, const std::string &why) {
  return posixError(EINVAL, "reading " + file + ": " + why);
}

}  // namespace

std::optional<std::string> placeholderText(const std::string &name, const FileState &state) {
  rapidjson::StringBuffer buffer;
  rapidjson::Writer<rapidjson::StringBuffer, rapidjson::UTF8<>, rapidjson::UTF8<>, rapidjson::CrtAllocator,
                    rapidjson::kWriteValidateEncodingFlag>
      writer(buffer);
  const double seconds =
      static_cast<double>(state.modificationTime.tv_sec) + static_cast<double>(state.modificationTime.tv_nsec) / 1e9;
  bool good = writer.StartObject();
  good = good && writer.Key("modificationTime") && writer.Double(seconds);
  good = good && writer.Key("name") && writer.String(name.data(), static_cast<rapidjson::SizeType>(name.size()));
  good = good && writer.Key("size") && writer.Int64(state.size);
  good = good && writer.EndObject();
  if (!good) return std::nullopt;
  return std::string(buffer.GetString(), buffer.GetSize()) + "\n";
}

Result<std::string> sourceFolderOfBundle(const std::string &bundlePath) {
  const std::string file = bundlePath + "/Info.kvs";
  std::ifstream stream(file, std::ios::binary);
  if (!stream) return noSource(file, "it cannot be opened");
  const std::string text{std::istreambuf_iterator<char>(stream), {}};
  rapidjson::Document info;
  info.Parse<rapidjson::kParseValidateEncodingFlag | rapidjson::kParseIterativeFlag>(text.data(), text.size());
  if (info.HasParseError()) return noSource(file, rapidjson::GetParseError_En(info.GetParseError()));
  if (!info.IsObject()) return noSource(file, "it is not a dictionary");
  const rapidjson::Value *source = rapidjson::Pointer("/FolderProviderSource").Get(info);
  if (!source || !source->IsString() || source->GetStringLength() == 0) {
    return noSource(file, "\"FolderProviderSource\" must name the folder to serve");
  }
  const std::string path(source->GetString(), source->GetStringLength());
  return path.starts_with('/') ? path : bundlePath + "/" + path;
}

/// Keeps an item to one thread as long as it lives; others wait.
class FolderProvider::ItemInUse {
 public:
  ItemInUse(FolderProvider &provider, std::string path) : provider_(provider), path_(std::move(path)) {
    std::unique_lock lock(provider_.mutex_);
    provider_.itemReleased_.wait(lock, [this] { return !provider_.itemsInUse_.contains(path_); });
    provider_.itemsInUse_.insert(path_);
  }
  ~ItemInUse() {
    {
      std::lock_guard lock(provider_.mutex_);
      provider_.itemsInUse_.erase(path_);
    }
    provider_.itemReleased_.notify_all();
  }
  ItemInUse(const ItemInUse &) = delete;
  ItemInUse &operator=(const ItemInUse &) = delete;

 private:
  FolderProvider &provider_;
  std::string path_;
};

FolderProvider::FolderProvider(ProviderEnvironment environment) : ProviderExtension(std::move(environment)) {
  // Nothing has begun yet, so whatever is half written is left from a process that ended early.
  if (auto provided = openProvided()) provided.value().discardIncoming();
  if (auto source = openSource()) source.value().discardIncoming();
}

void FolderProvider::performInitialSetup(Completion completion) {
  auto source = openSource();
  if (!source) return completion(source.error());
  ProviderExtension::performInitialSetup(std::move(completion));
}

void FolderProvider::providePlaceholder(const URL &url, URLCompletion completion) {
  auto path = pathOf(url);
  if (!path) return completion(path.error());
  ItemInUse inUse(*this, path.value());
  completion(writePlaceholder(path.value()));
}

void FolderProvider::startProviding(const URL &url, Completion completion) {
  auto path = pathOf(url);
  if (!path) return completion(path.error());
  ItemInUse inUse(*this, path.value());
  completion(start(path.value()));
}

void FolderProvider::itemChanged(const URL &url, Completion completion) {
  auto path = pathOf(url);
  if (!path) return completion(path.error());
  ItemInUse inUse(*this, path.value());
  completion(copyBack(path.value()));
}

void FolderProvider::stopProviding(const URL &url, Completion completion) {
  auto path = pathOf(url);
  if (!path) return completion(path.error());
  ItemInUse inUse(*this, path.value());
  completion(stop(path.value()));
}

void FolderProvider::itemIdentifier(const URL &url, IdentifierCompletion completion) {
  auto path = pathOf(url);
  if (!path) return completion(path.error());
  // An item that a consumer has just made is known by its copy, until that is copied back.
  auto source = openSource();
  if (!source) return completion(source.error());
  auto state = source.value().stateOf(path.value());
  if (!state) {
    auto provided = openProvided();
    if (!provided || !provided.value().stateOf(path.value())) return completion(state.error());
  }
  completion(std::move(path));
}

void FolderProvider::itemURL(const std::string &identifier, URLCompletion completion) {
  if (auto refused = FolderTree::checkPath(identifier)) return completion(*refused);
  auto source = openSource();
  if (!source) return completion(source.error());
  if (auto state = source.value().stateOf(identifier); !state) {
    auto provided = openProvided();
    if (!provided || !provided.value().stateOf(identifier)) return completion(state.error());
  }
  ProviderExtension::itemURL(identifier, std::move(completion));
}

Result<FolderTree> FolderProvider::openSource() const {
  auto folder = sourceFolderOfBundle(environment().bundlePath);
  if (!folder) return folder.error();
  return FolderTree::open(folder.value());
}

Result<FolderTree> FolderProvider::openProvided() const {
  const auto url = providedItemsURL();
  if (!url) return posixError(ENOENT, "looking for the group container of " + environment().bundlePath);
  return FolderTree::open(url->path());
}

Result<std::string> FolderProvider::pathOf(const URL &url) const {
  auto path = relativePath(url);
  if (!path) return posixError(EINVAL, "looking for a document of this provider at " + url.absoluteString());
  if (auto refused = FolderTree::checkPath(*path)) return *refused;
  return *path;
}

std::optional<SXError> FolderProvider::start(const std::string &path) {
  auto source = openSource();
  if (!source) return source.error();
  auto provided = openProvided();
  if (!provided) return provided.error();
  const auto there = source.value().stateOf(path);
  if (!there) return there.error();
  const auto here = provided.value().stateOf(path);
  if (here && (here.value().sameContentAs(there.value()) || here.value().newerThan(there.value()))) {
    return std::nullopt;
  }
  auto file = source.value().openFile(path);
  if (!file) return file.error();
  return provided.value().put(path, file.value().get());
}

std::optional<SXError> FolderProvider::copyBack(const std::string &path) {
  auto source = openSource();
  if (!source) return source.error();
  auto provided = openProvided();
  if (!provided) return provided.error();
  auto file = provided.value().openFile(path);
  if (!file) return file.error();
  return source.value().put(path, file.value().get());
}

std::optional<SXError> FolderProvider::stop(const std::string &path) {
  auto source = openSource();
  if (!source) return source.error();
  auto provided = openProvided();
  if (!provided) return provided.error();
  const auto here = provided.value().stateOf(path);
  if (!here) {
    const bool nothingToDrop = here.error().domain() == posixErrorDomain && here.error().code() == ENOENT;
    return nothingToDrop ? std::nullopt : std::optional(here.error());
  }
  const auto there = source.value().stateOf(path);
  if (!there || here.value().newerThan(there.value())) {
    if (auto failed = copyBack(path)) return failed;
  }
  return provided.value().remove(path);
}

Result<URL> FolderProvider::writePlaceholder(const std::string &path) {
  auto source = openSource();
  if (!source) return source.error();
  auto provided = openProvided();
  if (!provided) return provided.error();
  const auto state = source.value().stateOf(path);
  if (!state) return state.error();
  const auto text = placeholderText(path.substr(path.rfind('/') + 1), state.value());
  if (!text) return posixError(EILSEQ, "writing the placeholder of \"" + path + "\"");
  const auto companion = provided.value().putCompanion(path, *text);
  if (!companion) return companion.error();
  return providedItemsURL()->appendingPathComponent(companion.value());
}

}  // namespace storix::example
