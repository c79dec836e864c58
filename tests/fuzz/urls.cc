// URLs, and the operations on them and on texts that should be some.

#include "platform/URL.h"
#include "tests/fuzz/Target.h"

using storix::URL;
using storix::fuzz::require;

namespace {

void checkURL(const URL &url) {
  const std::string path = url.path();
  require(path.starts_with('/'), "the path is not absolute");
  require(path.find('\0') == std::string::npos, "the path holds a zero byte");
  require(path.size() <= url.absoluteString().size(), "the path is longer than its escaped form");
  for (const char character : url.absoluteString()) {
    require(character > ' ' && character < 127, "the text of a URL is not printable ASCII");
  }
  const std::optional<URL> again = URL::fromString(url.absoluteString());
  require(again == url, "the text of a URL parses differently");
  require(!url.lastPathComponent().empty(), "there is no last component");
  const std::optional<URL> fromPath = URL::fileURLWithPath(path, url.hasDirectoryPath());
  require(fromPath && fromPath->path() == path, "the URL of the path has another path");
  const URL parent = url.deletingLastPathComponent();
  require(parent.hasDirectoryPath(), "the parent is no directory");
  require(parent.absoluteString().size() <= url.absoluteString().size() + 1, "the parent is longer");
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const std::string_view text = storix::fuzz::textOf(bytes, size);
  std::string reason;
  const std::optional<URL> url = URL::fromString(text, &reason);
  if (url) {
    checkURL(*url);
  } else {
    require(!reason.empty(), "a refusal says nothing");
  }
  if (const std::optional<URL> ofPath = URL::fileURLWithPath(text)) {
    if (ofPath->absoluteString().size() <= URL::maximumLength) checkURL(*ofPath);
  }
  const URL appended = URL::fileURLWithPath("/base")->appendingPathComponent(text);
  require(appended.absoluteString().starts_with("file:///base"), "an appended component changed what was there");
  (void)storix::stringLastPathComponent(text);
  (void)storix::stringByDeletingLastPathComponent(text);
  (void)storix::stringByAppendingPathComponent("file:///base", text);
  return 0;
}
