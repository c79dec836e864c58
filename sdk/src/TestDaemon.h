#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "sdk/src/BusLoop.h"
#include "service/SXDaemon.h"
#include "wire/BusConnection.h"

namespace storix::sdk {

/// A daemon's object whose operations do what a test says. Those that it says nothing about stay
/// unanswered.
class ScriptedDaemon : public SXDaemon {
 public:
  std::function<void(CompletionHandler<>)> onWakeUp;
  std::function<void(std::vector<std::string>, SandboxReply)> onExtendSandbox;
  std::function<void(std::string operation, std::vector<std::string>, ErrorReply)> onItemOperation;
  std::function<void(ProvidersReply)> onProviders;
  std::function<void(std::vector<std::string>, BookmarkReply)> onExtendBookmark;
  std::function<void(std::string, BookmarkReply)> onBookmarkableString;
  std::function<void(std::string, DocumentReply)> onDocumentURL;

  void wakeUp(CompletionHandler<> completion) override;
  void extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                               std::optional<std::string> toConsumerID, SandboxReply completionHandler) override;
  void providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                      std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                               std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                              std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void providers(ProvidersReply completionHandler) override;
  void extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                BookmarkReply completionHandler) override;
  void bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) override;
  void documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                         DocumentReply completion) override;
};

/// Serves a scripted daemon, and the platform's methods as scripted, on sockets in a directory of its
/// own, over real connections.
class TestDaemon {
 public:
  TestDaemon();
  ~TestDaemon();
  TestDaemon(const TestDaemon &) = delete;
  TestDaemon &operator=(const TestDaemon &) = delete;

  /// Script before the first request.
  std::shared_ptr<ScriptedDaemon> daemon = std::make_shared<ScriptedDaemon>();
  wire::BusConnection::MethodHandler onConsume;
  wire::BusConnection::MethodHandler onProveWriteAccess;
  wire::BusConnection::MethodHandler onPost;
  wire::BusConnection::MethodHandler onBeginRead;
  wire::BusConnection::MethodHandler onEndRead;
  wire::BusConnection::MethodHandler onBeginWrite;
  wire::BusConnection::MethodHandler onEndWrite;
  std::function<void()> onPlatformConnection;
  std::function<void()> onPlatformConnectionClosed;

  [[nodiscard]] const std::string &directory() const { return directory_; }
  /// Drops every connection; new ones are accepted.
  void closeConnections();

 private:
  int listenOn(const std::string &name);
  void accept();
  void exportPlatform(wire::BusConnection &connection) const;

  std::string directory_;
  UniqueFd ended_;
  UniqueFd service_;
  UniqueFd platform_;
  BusLoop loop_;
  std::mutex mutex_;
  std::vector<std::weak_ptr<wire::BusConnection>> connections_;
  std::thread loopThread_;
  std::thread acceptThread_;
};

}  // namespace storix::sdk
