// A whole document provider, to begin your own with: copy this folder, and put what you serve in the place
// of `content`. Its documents are greetings: "anne.txt" greets Anne.

#include <storix/ProviderExtension.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <mutex>
#include <optional>
#include <string>

namespace fs = std::filesystem;

class TemplateProvider : public storix::ProviderExtension {
 public:
  using ProviderExtension::ProviderExtension;

  void startProviding(const storix::URL &url, Completion completion) override {
    const auto text = content(url);
    if (!text) return completion(missing());
    const std::lock_guard lock(mutex_);
    // What is there is complete, and may have been changed since.
    if (fs::exists(url.path())) return completion(std::nullopt);
    completion(put(url.path(), *text));
  }

  void stopProviding(const storix::URL &url, Completion completion) override {
    const std::lock_guard lock(mutex_);
    std::ifstream file(url.path());
    const std::string present{std::istreambuf_iterator<char>(file), {}};
    // Only what can be had again is dropped.
    std::error_code ignored;
    if (content(url) == present) fs::remove(url.path(), ignored);
    completion(std::nullopt);
  }

  void providePlaceholder(const storix::URL &url, URLCompletion completion) override {
    const auto text = content(url);
    if (!text) return completion(missing());
    const auto placeholder = url.deletingLastPathComponent().appendingPathComponent("." + url.lastPathComponent());
    const std::lock_guard lock(mutex_);
    if (auto error = put(placeholder.path(), "{\"size\":" + std::to_string(text->size()) + "}")) {
      return completion(*error);
    }
    completion(placeholder);
  }

  void itemIdentifier(const storix::URL &url, IdentifierCompletion completion) override {
    if (!content(url)) return completion(missing());
    ProviderExtension::itemIdentifier(url, std::move(completion));
  }

 private:
  /// Yours comes from a server, a database, another device. None where there is no such document.
  std::optional<std::string> content(const storix::URL &url) const {
    const auto path = relativePath(url);
    if (!path || !path->ends_with(".txt") || path->find('/') != std::string::npos) return std::nullopt;
    return "Good morning, " + path->substr(0, path->size() - 4) + ".\n";
  }

  /// Written elsewhere and renamed: whoever looks sees all of it, or nothing.
  std::optional<storix::SXError> put(const fs::path &target, const std::string &text) const {
    const fs::path unfinished = fs::path(providedItemsURL()->path()) / ".unfinished";
    std::ofstream file(unfinished);
    file << text;
    file.close();
    if (!file) return storix::posixError(EIO, "writing the document");
    std::error_code error;
    fs::rename(unfinished, target, error);
    if (error) return storix::posixError(error.value(), "putting the document in place");
    return std::nullopt;
  }

  static storix::SXError missing() { return storix::posixError(ENOENT, "looking for a greeting"); }

  std::mutex mutex_;
};

int main() { return storix::runProviderExtension<TemplateProvider>(); }
