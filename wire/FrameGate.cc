#include "wire/FrameGate.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <utility>

#include "wire/DescriptorCall.h"
#include "wire/SendBytes.h"

namespace storix::wire {

namespace {

constexpr std::size_t maximumLineSize = 16384;
/// Taken from the peer's socket at once.
constexpr std::size_t pieceSize = 16384;
/// So much memory a connection keeps for its next message.
constexpr std::size_t keptSize = 1024;

Framing::Verdict outcomeOf(ssize_t count) {
  if (count > 0) return Framing::Verdict::read;
  return count < 0 && (errno == EAGAIN || errno == EINTR) ? Framing::Verdict::nothing : Framing::Verdict::ended;
}

}  // namespace

std::unique_ptr<FrameGate> FrameGate::make(TakesDescriptor takesDescriptor, UniqueFd &busEnd) {
  std::array<int, 2> ends{-1, -1};
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) != 0) return nullptr;
  busEnd.reset(ends[1]);
  return std::unique_ptr<FrameGate>(new FrameGate(std::move(takesDescriptor), UniqueFd(ends[0])));
}

Framing::Verdict FrameGate::beforeProcess(int fd, bool hasUnwritten) {
  if (!passing_) {
    const Verdict collected = loggedIn_ ? collectMessage(fd) : collectLine(fd);
    // sd-bus watches over the time of the login.
    if (collected == Verdict::nothing && (hasUnwritten || !loggedIn_)) return Verdict::read;
    if (collected != Verdict::read) return collected;
    passing_ = true;
  }
  return pass();
}

Framing::Verdict FrameGate::afterProcess(int, const Processed &processed) {
  loggedIn_ = processed.loggedIn;
  if ((processed.gotMessage || processed.drained) && passing_ && passed_ == collected_.size()) {
    passing_ = false;
    passed_ = 0;
    collected_.clear();
    if (collected_.capacity() > keptSize) collected_.shrink_to_fit();
  }
  return Verdict::read;
}

void FrameGate::release() {
  end_.reset();
  descriptor_.reset();
}

/// Which line ends the login is for sd-bus to say; a message may follow right behind it.
Framing::Verdict FrameGate::collectLine(int fd) {
  std::array<char, 512> seen;
  const ssize_t count = recv(fd, seen.data(), seen.size(), MSG_PEEK | MSG_DONTWAIT);
  if (count <= 0) return outcomeOf(count);
  std::size_t wanted = 0;
  char last = collected_.empty() ? '\0' : collected_.back();
  bool isComplete = false;
  while (!isComplete && wanted < static_cast<std::size_t>(count)) {
    const char next = seen[wanted++];
    isComplete = last == '\r' && next == '\n';
    last = next;
  }
  const Verdict taken = take(fd, wanted);
  if (taken != Verdict::read) return taken;
  if (collected_.ends_with("\r\n")) return Verdict::read;
  return collected_.size() > maximumLineSize ? Verdict::loginTooLong : Verdict::nothing;
}

Framing::Verdict FrameGate::collectMessage(int fd) {
  for (;;) {
    const bool hasHeader = collected_.size() >= FixedHeader::size;
    const std::size_t wanted = hasHeader ? FixedHeader::of(collected_).messageSize() : FixedHeader::size;
    if (hasHeader && collected_.size() == wanted) break;
    if (const Verdict taken = take(fd, wanted - collected_.size()); taken != Verdict::read) return taken;
    if (collected_.size() != FixedHeader::size) continue;
    if (const Verdict header = FixedHeader::of(collected_).verdict(); header != Verdict::read) return header;
  }
  if (!descriptor_) return Verdict::read;
  std::optional<std::string> rewritten = rewrittenDescriptorCall(collected_, takesDescriptor_);
  if (!rewritten) return Verdict::unwantedDescriptor;
  collected_ = std::move(*rewritten);
  return Verdict::read;
}

/// Adds that many bytes to what has been collected, or fewer.
Framing::Verdict FrameGate::take(int fd, std::size_t count) {
  std::array<char, pieceSize> piece;
  iovec bytes{piece.data(), std::min(count, piece.size())};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
  msghdr message{};
  message.msg_iov = &bytes;
  message.msg_iovlen = 1;
  // Of more descriptors than there is room for the kernel makes none here, and says so.
  if (loggedIn_ && !descriptor_) {
    message.msg_control = control.data();
    message.msg_controllen = CMSG_LEN(sizeof(int));
  }
  const ssize_t taken = recvmsg(fd, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (taken <= 0) return outcomeOf(taken);
  if (const cmsghdr *header = CMSG_FIRSTHDR(&message); header && header->cmsg_type == SCM_RIGHTS) {
    int descriptor = -1;
    std::memcpy(&descriptor, CMSG_DATA(header), sizeof descriptor);
    descriptor_.reset(descriptor);
  }
  if ((message.msg_flags & MSG_CTRUNC) != 0) return Verdict::unwantedDescriptor;
  collected_.append(piece.data(), static_cast<std::size_t>(taken));
  return Verdict::read;
}

/// Writes as much as the pair takes; what sd-bus reads of it makes room for the rest.
Framing::Verdict FrameGate::pass() {
  if (passed_ == collected_.size()) return Verdict::read;
  const std::array<int, 1> descriptor{descriptor_.get()};
  const ssize_t written = sendBytes(end_.get(), std::string_view(collected_).substr(passed_),
                                    std::span(descriptor).first(descriptor_ ? 1 : 0));
  if (written < 0) return outcomeOf(written) == Verdict::nothing ? Verdict::read : Verdict::ended;
  descriptor_.reset();
  passed_ += static_cast<std::size_t>(written);
  return Verdict::read;
}

}  // namespace storix::wire
