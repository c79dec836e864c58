#include "examples/webdav-provider/TestDavServer.h"

#include <gtest/gtest.h>
#include <signal.h>

#include <charconv>
#include <ctime>
#include <filesystem>
#include <fstream>

namespace storix::example {

namespace fs = std::filesystem;

TestDavServer::TestDavServer() {
  fs::create_directory(folder_.path("documents"));
  folder_.write("password", "ann\nopen sesame\n");
  process_ = std::make_unique<e2e::Process>(
      std::vector<std::string>{STORIX_WEBDAV_SERVE, folder_.path("documents"), folder_.path("password")},
      e2e::Process::Environment{{"PATH", "/usr/sbin:/usr/bin:/sbin:/bin"}, {"TMPDIR", folder_.root()}});
  const auto line = process_->waitForLine("Serving ");
  if (!line) return;
  const std::string text = process_->errorLines()[*line];
  const std::size_t colon = text.rfind(':');
  std::from_chars(text.data() + colon + 1, text.data() + text.size(), port_);
}

void TestDavServer::write(const std::string &path, const std::string &content) {
  // Under another name first, since the server may be reading.
  folder_.write("incoming", content);
  folder_.setModificationTime("incoming", ::time(nullptr) - 3600 + written_++);
  fs::create_directories(fs::path(this->path(path)).parent_path());
  fs::rename(folder_.path("incoming"), this->path(path));
}

void TestDavServer::configure(const std::string &container, std::uint16_t port, const std::string &password) {
  std::ofstream(container + "/WebDAV.kvs") << R"({"URL": "http://127.0.0.1:)" << port << R"(/"})";
  const std::string credentials = container + "/WebDAV Credentials.kvs";
  std::ofstream(credentials) << R"({"Name": "ann", "Password": ")" << password << R"("})";
  fs::permissions(credentials, fs::perms::owner_read | fs::perms::owner_write);
}

}  // namespace storix::example
