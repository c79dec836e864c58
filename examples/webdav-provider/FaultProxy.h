#pragma once

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <list>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "wire/UniqueFd.h"

namespace storix::example {

/// Stands between a client and a server on this machine, records the requests, and lets go wrong what
/// the test says. Thread-safe.
class FaultProxy {
 public:
  explicit FaultProxy(std::uint16_t serverPort);
  ~FaultProxy();
  FaultProxy(const FaultProxy &) = delete;
  FaultProxy &operator=(const FaultProxy &) = delete;

  [[nodiscard]] std::uint16_t port() const { return port_; }

  /// What happens to the next request with that method. One after another, where there are several.
  struct Fault {
    std::string method;
    /// Runs before the request is passed on.
    std::function<void()> before;
    /// The connection is cut, or nothing more comes, after that many bytes of the answer.
    std::optional<std::size_t> cutAfter;
    std::optional<std::size_t> stallAfter;
    /// Sent in the place of the server's answer, and the connection closed.
    std::optional<std::string> answer;
  };
  void next(Fault fault);
  /// An answer without content.
  static std::string answerWithStatus(int status);

  /// While it is gone, connections are cut and new ones refused.
  void setGone(bool gone);

  /// The heads of the requests with that method so far.
  [[nodiscard]] std::vector<std::string> requests(const std::string &method) const;
  /// Waits until there are that many.
  void waitForRequests(const std::string &method, std::size_t count) const;

 private:
  struct Connection {
    UniqueFd client;
    UniqueFd server;
    std::thread thread;
  };

  void listen();
  void accept();
  void serve(Connection &connection);
  /// False: the connection is to be closed.
  bool passRequest(Connection &connection, std::optional<Fault> &active);
  bool passAnswer(Connection &connection, std::optional<Fault> &active, std::size_t &passed);
  std::optional<Fault> take(const std::string &method);
  void end();

  const std::uint16_t serverPort_;
  std::uint16_t port_ = 0;

  mutable std::mutex mutex_;
  mutable std::condition_variable requested_;
  std::list<Fault> faults_;
  std::vector<std::string> heads_;
  std::list<Connection> connections_;
  UniqueFd stop_;
  UniqueFd listening_;
  std::thread accepting_;
};

}  // namespace storix::example
