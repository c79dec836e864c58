#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "examples/folder-provider/ProviderCalls.h"
#include "examples/webdav-provider/Configuration.h"
#include "examples/webdav-provider/FaultProxy.h"
#include "examples/webdav-provider/TestDavServer.h"
#include "examples/webdav-provider/WebDavProvider.h"

namespace storix::example {

/// A provider of a real server, with a proxy between them that lets things go wrong.
class WebDavProviderTest : public ProviderCalls {
 protected:
  WebDavProviderTest() : proxy_(server_.port()) {
    std::filesystem::create_directories(folder_.path("group/Storix Storage"));
    TestDavServer::configure(folder_.path("group"), proxy_.port());
  }

  WebDavProvider &provider() {
    if (!provider_) {
      provider_ = std::make_unique<WebDavProvider>(
          ProviderEnvironment{folder_.path("dav.appdex"), folder_.path("group")}, [this](const std::string &container) {
            auto settings = readConfiguration(container);
            if (settings) {
              settings.value().attempts = attempts_;
              settings.value().retryDelay = std::chrono::milliseconds(1);
              settings.value().http.stallTimeout = stallTimeout_;
              settings.value().progressInterval = progressInterval_;
            }
            return settings;
          });
    }
    return *provider_;
  }
  /// As if the process had ended and been started again.
  void restart() { provider_.reset(); }

  [[nodiscard]] std::string localPath(const std::string &path) const {
    return folder_.path("group/Storix Storage/" + path);
  }
  ProviderExtension &extension() override { return provider(); }
  [[nodiscard]] URL item(const std::string &path) const override { return *URL::fileURLWithPath(localPath(path)); }
  [[nodiscard]] std::string local(const std::string &path) const {
    return folder_.read("group/Storix Storage/" + path);
  }
  [[nodiscard]] bool isHere(const std::string &path) const { return std::filesystem::exists(localPath(path)); }
  void change(const std::string &path, const std::string &content) const {
    folder_.write("group/Storix Storage/" + path, content);
  }
  [[nodiscard]] bool nothingHalfDownloaded() const {
    return !isHere(".incoming") || std::filesystem::is_empty(localPath(".incoming"));
  }

  /// The document is on the server and here.
  void provide(const std::string &path, const std::string &content) {
    server_.write(path, content);
    const auto failed = start(path);
    ASSERT_FALSE(failed) << failed->message();
    ASSERT_EQ(local(path), content);
  }

  static testing::Matcher<const std::optional<SXError> &> failsWith(int number, const std::string &words = "") {
    return testing::Optional(
        testing::AllOf(testing::Property("code", &SXError::code, number),
                       testing::Property("message", &SXError::message, testing::HasSubstr(words))));
  }
  static constexpr std::nullopt_t succeeded = std::nullopt;

  TemporaryFolder folder_;
  TestDavServer server_;
  FaultProxy proxy_;
  int attempts_ = 4;
  std::chrono::seconds stallTimeout_{30};
  std::chrono::milliseconds progressInterval_{500};
  std::unique_ptr<WebDavProvider> provider_;
};

}  // namespace storix::example
