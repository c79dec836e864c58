#include "tools/check-extension/CheckItem.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/inotify.h>
#include <sys/stat.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <memory>
#include <system_error>
#include <utility>
#include <vector>

#include "platform/SXError.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "tools/check-extension/CheckBadInput.h"
#include "wire/UniqueFd.h"

namespace storix::check {

namespace {

namespace fs = std::filesystem;

using Checksum = std::array<unsigned char, crypto_hash_sha256_BYTES>;

/// Of a file's content, or in words why it is none that can be opened by a token.
std::variant<Checksum, std::string> checksumOf(const std::string &path) {
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
  if (!file && errno == ELOOP) return "is a symbolic link";
  if (!file) return "cannot be opened (" + std::string(std::strerror(errno)) + ")";
  struct stat status {};
  if (::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return "is not a regular file";
  crypto_hash_sha256_state state;
  crypto_hash_sha256_init(&state);
  auto buffer = std::make_unique<std::array<unsigned char, std::size_t{256} << 10>>();
  for (;;) {
    const ssize_t count = ::read(file.get(), buffer->data(), buffer->size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return "cannot be read (" + std::string(std::strerror(errno)) + ")";
    if (count == 0) break;
    crypto_hash_sha256_update(&state, buffer->data(), static_cast<std::size_t>(count));
  }
  Checksum checksum{};
  crypto_hash_sha256_final(&state, checksum.data());
  return checksum;
}

/// Knows whether a file was written to while it stood under its name.
class NameWatch {
 public:
  explicit NameWatch(const fs::path &file)
      : name_(file.filename()), inotify_(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
    if (inotify_) ::inotify_add_watch(inotify_.get(), file.parent_path().c_str(), IN_MODIFY);
  }

  /// Since the last time.
  bool wasWritten() {
    bool written = false;
    alignas(inotify_event) std::array<char, 16'384> buffer{};
    for (;;) {
      const ssize_t size = ::read(inotify_.get(), buffer.data(), buffer.size());
      if (size < 0 && errno == EINTR) continue;
      if (size <= 0) return written;
      for (std::size_t at = 0; at < static_cast<std::size_t>(size);) {
        const auto *event = reinterpret_cast<const inotify_event *>(&buffer[at]);
        if (event->len > 0 && name_ == event->name) written = true;
        at += sizeof(inotify_event) + event->len;
      }
    }
  }

 private:
  std::string name_;
  UniqueFd inotify_;
};

/// The directories above a file that were missing; removed at the end where they are empty.
class MissingDirectories {
 public:
  explicit MissingDirectories(const fs::path &file) {
    fs::path directory = file.parent_path();
    for (std::error_code failed; !fs::exists(directory, failed) && directory.has_relative_path();) {
      made_.push_back(directory);
      directory = directory.parent_path();
    }
    std::error_code failed;
    fs::create_directories(file.parent_path(), failed);
  }
  ~MissingDirectories() {
    std::error_code ignored;
    for (const fs::path &directory : made_) fs::remove(directory, ignored);
  }
  MissingDirectories(const MissingDirectories &) = delete;
  MissingDirectories &operator=(const MissingDirectories &) = delete;

 private:
  std::vector<fs::path> made_;
};

/// One document under examination.
class ItemCheck {
 public:
  ItemCheck(CheckedExtension &extension, const URL &storage, std::string subject)
      : extension_(extension), storage_(storage), subject_(std::move(subject)) {}

  std::optional<URL> find(const KnownItem &item);
  bool identify(const URL &url, const std::optional<std::string> &known);
  void provide(const URL &url);
  void provideOnce(const URL &url);

 private:
  /// The answer to a question that must succeed.
  std::optional<ExtensionAnswer> succeed(Operation operation, const Argument &argument);
  void error(Operation operation, const std::string &sentence) {
    extension_.findings().error(std::string(operationName(operation)) + " for " + subject_ + ": " + sentence);
  }
  void checkPlaceholder(const URL &url);
  void readPlaceholder(const URL &placeholder, const URL &url);
  /// Whether the file is complete and stays so.
  bool start(const URL &url, NameWatch &watch);
  void checkContent(const URL &url, const std::string &when);

  CheckedExtension &extension_;
  const URL &storage_;
  const std::string subject_;
  std::optional<std::string> identifier_;
  std::optional<Checksum> content_;
  std::optional<std::int64_t> announcedSize_;
};

std::optional<ExtensionAnswer> ItemCheck::succeed(Operation operation, const Argument &argument) {
  auto answer = extension_.ask(operation, argument, subject_);
  if (!answer) return std::nullopt;
  if (const auto failure = failureOf(*answer)) {
    error(operation, *failure);
    return std::nullopt;
  }
  return answer;
}

std::optional<URL> ItemCheck::find(const KnownItem &item) {
  if (!item.identifier) return storage_.appendingPathComponent(item.path);
  const auto answer = succeed(Operation::itemURL, Value(*item.identifier));
  if (!answer) return std::nullopt;
  if (!answer->url) {
    error(Operation::itemURL, "answered neither a URL nor an error; the daemon takes that for success.");
  } else if (!liesBelow(*answer->url, storage_)) {
    error(Operation::itemURL, "answered " + answer->url->absoluteString() + ", which does not lie below " +
                                  storage_.absoluteString() + ".");
  } else {
    return answer->url;
  }
  return std::nullopt;
}

bool ItemCheck::identify(const URL &url, const std::optional<std::string> &known) {
  const auto answer = succeed(Operation::itemIdentifier, Value(url));
  if (!answer) return false;
  if (answer->string.value_or("").empty()) {
    error(Operation::itemIdentifier, "answered neither an identifier nor an error; the daemon takes that for success.");
    return false;
  }
  const std::string &identifier = *answer->string;
  if (known && identifier != *known) {
    error(Operation::itemIdentifier, "the identifier of its URL is \"" + identifier + "\".");
  }
  if (identifier_ && identifier != *identifier_) {
    error(Operation::itemIdentifier, "the identifier was \"" + *identifier_ + "\" and is now \"" + identifier +
                                         "\"; grants and bookmarks need one that lasts.");
  }
  identifier_ = identifier;
  const auto back = succeed(Operation::itemURL, Value(identifier));
  if (back && back->url != url) {
    error(Operation::itemURL, "its identifier \"" + identifier + "\" leads to " +
                                  (back->url ? back->url->absoluteString() : "no URL") + " instead of " +
                                  url.absoluteString() + ".");
  }
  return true;
}

void ItemCheck::checkPlaceholder(const URL &url) {
  std::error_code failed;
  const bool wasThere = fs::exists(url.path(), failed);
  const auto answer = extension_.ask(Operation::providePlaceholder, Value(url), subject_);
  if (!answer) return;
  if (answer->error && answer->error->domain() == posixErrorDomain && answer->error->code() == ENOTSUP) {
    extension_.findings().advice(
        "ProvidePlaceholderAtURL: the provider makes no placeholders; with them people see "
        "name and size of a document before it is there.");
    return;
  }
  if (const auto failure = failureOf(*answer)) return error(Operation::providePlaceholder, *failure);
  if (!wasThere && fs::exists(url.path(), failed)) {
    error(Operation::providePlaceholder,
          "something stands at the document's own name now; a placeholder needs another "
          "one, such as the companion's, with \".\" in front.");
  }
  if (!answer->url) {
    error(Operation::providePlaceholder, "answered neither a URL nor an error.");
  } else if (*answer->url == url) {
    error(Operation::providePlaceholder,
          "answered the document's own URL; a placeholder needs another one, such as the "
          "companion's, with \".\" in front.");
  } else if (!liesBelow(*answer->url, storage_)) {
    error(Operation::providePlaceholder,
          "answered " + answer->url->absoluteString() + ", which does not lie in the provided-items directory.");
  } else if (!fs::is_regular_file(answer->url->path(), failed)) {
    error(Operation::providePlaceholder, "answered " + answer->url->absoluteString() + ", where there is no file.");
  } else {
    readPlaceholder(*answer->url, url);
  }
}

void ItemCheck::readPlaceholder(const URL &placeholder, const URL &url) {
  const std::string what = "ProvidePlaceholderAtURL for " + subject_ + ": ";
  if (placeholder != url.deletingLastPathComponent().appendingPathComponent("." + url.lastPathComponent())) {
    extension_.findings().advice(what +
                                 "the placeholder is only found beside the document, under its name with \".\" "
                                 "in front.");
  }
  const auto content = linuxhost::readKeyedValueFile(placeholder.path());
  if (!content) {
    extension_.findings().advice(what + "nobody can read the placeholder: " + content.error().message());
    return;
  }
  const auto size = content.value().find("size");
  const std::int64_t *bytes = size == content.value().end() ? nullptr : size->second.integer();
  if (!bytes || *bytes < 0) {
    extension_.findings().advice(what + "a placeholder needs the number \"size\", the bytes of the document.");
    return;
  }
  announcedSize_ = *bytes;
}

void ItemCheck::checkContent(const URL &url, const std::string &when) {
  const auto found = checksumOf(url.path());
  if (const auto *why = std::get_if<std::string>(&found)) {
    error(Operation::startProviding, when + ", the file " + *why + ".");
    return;
  }
  const Checksum &checksum = std::get<Checksum>(found);
  if (content_ && *content_ != checksum) {
    error(Operation::startProviding, when + ", the file's content is not the one that was there at first.");
  }
  content_ = checksum;
  std::error_code failed;
  const auto size = fs::file_size(url.path(), failed);
  if (announcedSize_ && !failed && static_cast<std::uintmax_t>(*announcedSize_) != size) {
    error(Operation::providePlaceholder, "the placeholder says that the document has " +
                                             std::to_string(*announcedSize_) + " bytes, and it has " +
                                             std::to_string(size) + ".");
  }
}

bool ItemCheck::start(const URL &url, NameWatch &watch) {
  if (!succeed(Operation::startProviding, Value(url))) return false;
  if (watch.wasWritten()) {
    error(Operation::startProviding,
          "the file was written to while it stood under its name, so that readers see half a "
          "document; write it elsewhere in the directory and rename it.");
  }
  checkContent(url, "when it was reported as there");
  return content_.has_value();
}

void ItemCheck::provide(const URL &url) {
  const MissingDirectories above(url.path());
  succeed(Operation::stopProviding, Value(url));
  checkPlaceholder(url);
  NameWatch watch(url.path());
  if (!start(url, watch)) return;

  std::vector<CheckedExtension::Question> questions;
  for (int i = 0; i < 8; ++i) {
    questions.emplace_back(Operation::startProviding, Value(url));
    questions.emplace_back(Operation::itemIdentifier, Value(url));
  }
  for (const auto &answer : extension_.askAtOnce(questions, subject_ + ", many at once")) {
    const auto failure = answer ? failureOf(*answer) : std::nullopt;
    if (failure) error(Operation::startProviding, "asked many times at once, it answers an error: " + *failure);
  }
  succeed(Operation::itemChanged, Value(url));
  if (watch.wasWritten()) {
    error(Operation::startProviding, "the file was still written to after it had been reported as there.");
  }
  checkContent(url, "asked for once more");
  succeed(Operation::stopProviding, Value(url));

  // The daemon may go at any time, and readers look at any time.
  extension_.endWhile(Operation::startProviding, Value(url));
  std::error_code failed;
  if (fs::exists(url.path(), failed)) checkContent(url, "when the process was ended in the middle");
  if (!extension_.start()) return;
  NameWatch again(url.path());
  if (start(url, again)) identify(url, std::nullopt);
  succeed(Operation::stopProviding, Value(url));
}

void ItemCheck::provideOnce(const URL &url) {
  const MissingDirectories above(url.path());
  NameWatch watch(url.path());
  if (start(url, watch)) succeed(Operation::stopProviding, Value(url));
}

std::string subjectOf(const KnownItem &item) {
  return item.identifier ? "the item \"" + *item.identifier + "\"" : "the file \"" + item.path + "\"";
}

}  // namespace

std::optional<URL> checkItem(CheckedExtension &extension, const KnownItem &item, const URL &storage) {
  ItemCheck check(extension, storage, subjectOf(item));
  const auto url = check.find(item);
  if (!url || !check.identify(*url, item.identifier)) return std::nullopt;
  check.identify(*url, item.identifier);
  check.provide(*url);
  return url;
}

void checkThatItemIsServed(CheckedExtension &extension, const KnownItem &item, const URL &storage) {
  ItemCheck check(extension, storage, subjectOf(item));
  const auto url = check.find(item);
  if (url && check.identify(*url, item.identifier)) check.provideOnce(*url);
}

void checkDescriptors(CheckedExtension &extension, const std::optional<URL> &item, const URL &storage) {
  constexpr std::size_t rounds = 10;
  const URL missing = storage.appendingPathComponent("storix-check/no such document");
  const auto round = [&] {
    for (const Operation operation : {Operation::itemIdentifier, Operation::providePlaceholder,
                                      Operation::startProviding, Operation::stopProviding}) {
      extension.ask(operation, Value(missing), "a document that does not exist");
      if (item) extension.ask(operation, Value(*item), "a document, again and again");
    }
    extension.ask(Operation::itemURL, Value("storix-check/no such document"), "a document that does not exist");
  };
  round();
  const std::size_t before = extension.countDescriptors();
  for (std::size_t i = 0; i < rounds; ++i) round();
  const std::size_t after = extension.countDescriptors();
  std::error_code ignored;
  fs::remove(missing.path(), ignored);
  fs::remove(missing.deletingLastPathComponent().path(), ignored);
  if (before == 0 || after < before + rounds) return;
  extension.findings().error("The process has " + std::to_string(after - before) +
                             " descriptors more open after it was asked the same things " + std::to_string(rounds) +
                             " times; it leaks them.");
}

}  // namespace storix::check
