#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace storix::wire {

inline constexpr std::size_t maximumMessageSize = std::size_t{1} << 20;

/// How what a peer sends is cut into messages before sd-bus takes it in, since sd-bus itself would
/// collect 128 MiB of one and read other versions in its own way. Belongs to one connection and is
/// guarded by its mutex.
class Framing {
 public:
  enum class Verdict {
    read,
    nothing,
    /// The peer has ended the connection.
    ended,
    // What the connection is ended for:
    loginTooLong,
    noMessage,
    otherVersion,
    tooLarge,
    unwantedDescriptor,
  };
  /// What one `sd_bus_process` has done.
  struct Processed {
    bool loggedIn = false;
    bool gotMessage = false;
    /// It found nothing more to do.
    bool drained = false;
  };

  virtual ~Framing() = default;

  /// Before each `sd_bus_process`. `hasUnwritten` says that it has something to write; without, it
  /// need not be called when the answer is `nothing`.
  virtual Verdict beforeProcess(int fd, bool hasUnwritten) = 0;
  /// After it: `read`, or what the connection is to be ended for.
  virtual Verdict afterProcess(int fd, const Processed &processed) = 0;

  /// True where nothing of a further message has been taken from the socket.
  [[nodiscard]] virtual bool atBoundary() const = 0;
  /// True where something has been taken from the socket that sd-bus has yet to read.
  [[nodiscard]] virtual bool holdsUnread() const = 0;

  /// Closes the descriptors that it has of its own. The connection has ended.
  virtual void release() {}
};

/// The beginning of every message, and what it says of the whole.
struct FixedHeader {
  static constexpr std::size_t size = 16;

  std::array<char, size> bytes{};

  static FixedHeader of(std::string_view message);

  [[nodiscard]] bool isLittleEndian() const { return bytes[0] == 'l'; }
  [[nodiscard]] std::size_t bodySize() const { return numberAt(4); }
  [[nodiscard]] std::size_t serial() const { return numberAt(8); }
  [[nodiscard]] std::size_t fieldsSize() const { return numberAt(12); }
  /// The fixed header and the fields, padded to 8.
  [[nodiscard]] std::size_t bodyBegin() const { return size + ((fieldsSize() + 7) & ~std::size_t{7}); }
  [[nodiscard]] std::size_t messageSize() const { return bodyBegin() + bodySize(); }
  /// `read`, `noMessage`, `otherVersion` or `tooLarge`.
  [[nodiscard]] Framing::Verdict verdict() const;

 private:
  [[nodiscard]] std::size_t numberAt(std::size_t offset) const;
};

}  // namespace storix::wire
