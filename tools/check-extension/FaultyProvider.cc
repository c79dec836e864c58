// A provider for the tests of the check, on sd-bus alone, since the SDK makes most of these faults
// impossible. It does one thing wrong, which the file "fault" in its bundle names, and everything else
// right: its documents are the files in "documents" in its bundle.

#include <fcntl.h>
#include <poll.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <optional>
#include <string>

#include "platform/URL.h"

namespace {

namespace fs = std::filesystem;
using storix::URL;

std::string fault;
fs::path documents;
fs::path storage;
int stops = 0;
int identifiersGiven = 0;
std::optional<fs::path> unfinished;

bool is(std::string_view name) { return fault == name; }

std::string readFile(const fs::path &path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

void writeFile(const fs::path &path, const std::string &content) { std::ofstream(path, std::ios::binary) << content; }

/// Of the one argument; none when it is absent.
std::optional<std::string> argumentOf(sd_bus_message *message) {
  const char *text = nullptr;
  if (sd_bus_message_enter_container(message, 'a', "s") < 0 || sd_bus_message_read(message, "s", &text) <= 0) {
    return std::nullopt;
  }
  return std::string(text);
}

constexpr const char *failure = "no such document";

/// The path relative to the directory, if it is one of a place in it.
std::optional<std::string> relativePath(const std::optional<std::string> &argument) {
  const auto url = URL::fromString(argument.value_or(""));
  if (!url) return std::nullopt;
  std::error_code failed;
  const fs::path relative = fs::weakly_canonical(url->path(), failed).lexically_relative(storage);
  if (failed || relative.empty() || relative == "." || *relative.begin() == "..") return std::nullopt;
  return relative.string();
}

std::optional<std::string> documentPath(const std::optional<std::string> &argument) {
  const auto path = relativePath(argument);
  std::error_code failed;
  return path && fs::is_regular_file(documents / *path, failed) ? path : std::nullopt;
}

int replyOutcome(sd_bus_message *message, bool good) {
  if (good) return sd_bus_reply_method_return(message, "a(sxa{sv})", 0);
  return sd_bus_reply_method_return(message, "a(sxa{sv})", 1, "org.sample", std::int64_t{1}, 1, "description", "s",
                                    failure);
}

int replyText(sd_bus_message *message, const std::optional<std::string> &text) {
  if (text) return sd_bus_reply_method_return(message, "a(sxa{sv})as", 0, 1, text->c_str());
  return sd_bus_reply_method_return(message, "a(sxa{sv})as", 1, "org.sample", std::int64_t{1}, 1, "description", "s",
                                    failure, 0);
}

/// Before every operation.
void beginWork() {
  if (is("leaks descriptors")) static_cast<void>(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  if (unfinished) writeFile(*unfinished, readFile(*unfinished) + "the rest");
  unfinished.reset();
}

int performInitialSetup(sd_bus_message *message, void *, sd_bus_error *) {
  if (is("fails its setup")) {
    return sd_bus_reply_method_return(message, "asasa(sxa{sv})", 0, 0, 1, "org.sample", std::int64_t{1}, 1,
                                      "description", "s", "The account is locked.");
  }
  std::error_code failed;
  if (!is("makes no directory")) fs::create_directories(storage, failed);
  return sd_bus_reply_method_return(message, "asasa(sxa{sv})", 0, 0, 0);
}

int providePlaceholder(sd_bus_message *message, void *, sd_bus_error *) {
  beginWork();
  const auto argument = argumentOf(message);
  const auto path = documentPath(argument);
  if (!path) {
    if (is("never answers")) return 1;
    return sd_bus_reply_method_return(message, "asa(sxa{sv})", 0, 1, "org.sample", std::int64_t{1}, 1, "description",
                                      "s", failure);
  }
  fs::path place = (storage / *path).parent_path() / ("." + (storage / *path).filename().string());
  if (is("puts the placeholder in the document's place")) place = storage / *path;
  if (is("hides the placeholder")) place += ".placeholder";
  std::string text = "{\"size\":" + std::to_string(fs::file_size(documents / *path)) + "}";
  if (is("writes an odd placeholder")) text = "a placeholder";
  if (is("leaves out the size")) text = "{}";
  if (is("is wrong about the size")) text = "{\"size\":1}";
  if (!is("makes up a placeholder")) writeFile(place, text);
  return sd_bus_reply_method_return(message, "asa(sxa{sv})", 1,
                                    URL::fileURLWithPath(place.string())->absoluteString().c_str(), 0);
}

int startProviding(sd_bus_message *message, void *, sd_bus_error *) {
  beginWork();
  const auto argument = argumentOf(message);
  const auto path = documentPath(argument);
  if (!path && is("exits for a missing document")) ::_exit(3);
  if (!path && is("aborts without an argument") && !argument) ::abort();
  const auto url = URL::fromString(argument.value_or(""));
  if (url && is("writes anywhere")) {
    writeFile(url->path(), "provided");
    return replyOutcome(message, true);
  }
  if (!path) return replyOutcome(message, is("provides nothing at all"));
  const fs::path target = storage / *path;
  const std::string content = readFile(documents / *path);
  if (is("provides nothing at all")) return replyOutcome(message, true);
  if (is("leaves half a document") && stops == 2 && !fs::exists(documents / "left")) {
    writeFile(documents / "left", "");
    writeFile(target, content.substr(0, content.size() / 2));
    pollfd hungUp{3, POLLRDHUP, 0};
    ::poll(&hungUp, 1, -1);
    ::_exit(0);
  }
  if (is("writes in place")) {
    writeFile(target, content);
    return replyOutcome(message, true);
  }
  const fs::path incoming = storage / ".incoming";
  writeFile(incoming, is("goes on after its answer") ? "half and " : content);
  fs::rename(incoming, target);
  if (is("goes on after its answer")) unfinished = target;
  return replyOutcome(message, true);
}

int itemChanged(sd_bus_message *message, void *, sd_bus_error *) {
  beginWork();
  return replyOutcome(message, documentPath(argumentOf(message)).has_value());
}

int stopProviding(sd_bus_message *message, void *, sd_bus_error *) {
  beginWork();
  const auto argument = argumentOf(message);
  const auto url = URL::fromString(argument.value_or(""));
  std::error_code failed;
  if (url && is("removes anything")) {
    fs::remove_all(url->path(), failed);
    return replyOutcome(message, true);
  }
  const auto path = documentPath(argument);
  if (path) {
    ++stops;
    fs::remove(storage / *path, failed);
  }
  return replyOutcome(message, path.has_value());
}

int identifierForItem(sd_bus_message *message, void *, sd_bus_error *) {
  beginWork();
  const auto argument = argumentOf(message);
  if (is("answers neither")) return sd_bus_reply_method_return(message, "a(sxa{sv})as", 0, 0);
  if (is("answers with another signature")) return sd_bus_reply_method_return(message, "s", "a");
  if (is("identifies everything")) return replyText(message, argument.value_or("nothing"));
  auto path = relativePath(argument);
  if (path && is("gives identifiers that change")) *path += std::to_string(++identifiersGiven);
  if (path && is("gives identifiers that do not last")) *path = std::to_string(::getpid()) + ":" + *path;
  return replyText(message, path);
}

int urlForIdentifier(sd_bus_message *message, void *, sd_bus_error *) {
  beginWork();
  auto identifier = argumentOf(message);
  if (identifier && is("gives identifiers that do not last")) identifier->erase(0, identifier->find(':') + 1);
  if (is("takes identifiers for paths") && identifier) {
    return replyText(message, URL::fileURLWithPath(storage.string() + "/" + *identifier)->absoluteString());
  }
  if (is("loses its way back") && identifier) identifier->push_back('x');
  const auto url = URL::fileURLWithPath(storage.string() + "/" + identifier.value_or(""));
  if (!identifier || identifier->empty() || !relativePath(url->absoluteString())) return replyText(message, {});
  return replyText(message, url->absoluteString());
}

const sd_bus_vtable vtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("PerformInitialSetup", "", "asasa(sxa{sv})", performInitialSetup, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("ProvidePlaceholderAtURL", "as", "asa(sxa{sv})", providePlaceholder, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("StartProvidingItemAtURL", "as", "a(sxa{sv})", startProviding, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("ItemChangedAtURL", "as", "a(sxa{sv})", itemChanged, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("StopProvidingItemAtURL", "as", "a(sxa{sv})", stopProviding, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("URLForItemIdentifier", "as", "a(sxa{sv})as", urlForIdentifier, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

const sd_bus_vtable identifierVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("IdentifierForItemAtURL", "as", "a(sxa{sv})as", identifierForItem, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

const sd_bus_vtable otherIdentifierVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("IdentifierForItemAtURL", "as", "s", identifierForItem, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

void serve(int socket) {
  sd_bus *bus = nullptr;
  if (sd_bus_new(&bus) < 0 || sd_bus_set_fd(bus, socket, socket) < 0 || sd_bus_start(bus) < 0) ::_exit(100);
  for (const sd_bus_vtable *table :
       {vtable, is("answers with another signature") ? otherIdentifierVtable : identifierVtable}) {
    if (sd_bus_add_object_vtable(bus, nullptr, "/com/tessel/StorixVendor", "com.tessel.StorixVendor", table, nullptr) <
        0) {
      ::_exit(101);
    }
  }
  for (;;) {
    const int processed = sd_bus_process(bus, nullptr);
    if (processed < 0) break;
    if (processed == 0 && sd_bus_wait(bus, UINT64_MAX) < 0) break;
  }
  sd_bus_close_unref(bus);
}

}  // namespace

int main() {
  const char *bundle = std::getenv("STORIX_BUNDLE_PATH");
  const char *container = std::getenv("STORIX_GROUP_CONTAINER");
  const char *socket = std::getenv("STORIX_EXTENSION_FD");
  if (!bundle || !container || !socket) return 99;
  fault = readFile(fs::path(bundle) / "fault");
  documents = fs::path(bundle) / "documents";
  storage = fs::path(container) / "Storix Storage";
  std::cerr << "the fault: " << fault << std::endl;
  if (is("exits before its login")) return 7;
  serve(std::atoi(socket));
  while (is("does not end")) ::pause();
  return is("ends with a status") ? 4 : 0;
}
