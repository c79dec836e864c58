#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <memory>
#include <string>

#include "examples/folder-provider/TemporaryFolder.h"
#include "tests/e2e/Process.h"

namespace storix::example {

/// A real WebDAV server on the loopback address, started by the script "serve", with a folder of its own.
/// The name is "ann", the password "open sesame".
class TestDavServer {
 public:
  TestDavServer();

  [[nodiscard]] std::uint16_t port() const { return port_; }

  /// Puts a document into the folder, an hour old and each a second younger than the one before: so the
  /// server is sure of its version.
  void write(const std::string &path, const std::string &content);
  [[nodiscard]] std::string read(const std::string &path) const { return folder_.read("documents/" + path); }
  [[nodiscard]] std::string path(const std::string &relative) const { return folder_.path("documents/" + relative); }

  /// Writes "WebDAV.kvs" and the credentials for the server, reached through the port, into a container.
  static void configure(const std::string &container, std::uint16_t port, const std::string &password = "open sesame");

 private:
  TemporaryFolder folder_;
  std::unique_ptr<e2e::Process> process_;
  std::uint16_t port_ = 0;
  int written_ = 0;
};

}  // namespace storix::example
