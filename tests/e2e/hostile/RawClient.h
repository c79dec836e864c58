#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "tests/e2e/hostile/WireBytes.h"
#include "wire/UniqueFd.h"

namespace storix::e2e {

/// What came back: an answer, or the name of a D-Bus error.
struct RawAnswer {
  std::uint8_t type = 0;
  std::uint32_t replyTo = 0;
  std::string errorName;
  std::string body;
};

/// A client that sends bytes, whichever it likes. Failures to connect or to send fail the test, but for
/// `offer`, and so does a wait beyond the deadline.
class RawClient {
 public:
  enum class Login { done, none };

  explicit RawClient(const std::filesystem::path &socket, Login login = Login::done);

  [[nodiscard]] int fd() const { return socket_.get(); }
  /// All of them. False when the other end is closed.
  bool send(std::string_view bytes) const;
  bool send(const Message &message) const { return send(message.bytes()); }
  /// With copies of a descriptor; all of the bytes, or the test fails.
  bool sendWithDescriptors(std::string_view bytes, int descriptor, std::size_t count) const;
  /// As many as the socket takes without waiting.
  std::size_t offer(std::string_view bytes) const;

  /// The next message; none when the connection is closed.
  std::optional<RawAnswer> read();
  /// The answer to the message of that serial; those before it are dropped.
  std::optional<RawAnswer> readAnswerTo(std::uint32_t serial);
  /// Sends the message and gives the name of the error that it got, "" for a result, "closed" when the
  /// connection is.
  std::string call(const Message &message);

  /// Whether the daemon closes the connection, after whatever it still has to say.
  bool isClosed();

 private:
  bool readBytes(std::string &out, std::size_t count);
  void login();

  UniqueFd socket_;
  std::string received_;
};

/// What `RawClient` sends to log in; it needs no answer before it goes on.
std::string_view loginBytes();

}  // namespace storix::e2e
