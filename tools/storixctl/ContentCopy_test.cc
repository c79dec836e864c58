#include "tools/storixctl/ContentCopy.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <thread>

#include "storix/ClientOptions.h"
#include "tools/storixctl/SteppedWaiting.h"
#include "tools/storixctl/TemporaryDirectory.h"

namespace storix::ctl {
namespace {

using ::testing::HasSubstr;

class ContentCopyTest : public ::testing::Test {
 protected:
  ContentCopyTest() { (void)::signal(SIGPIPE, SIG_IGN); }

  UniqueFd file(const std::string &name, int flags) const {
    UniqueFd opened(::open((directory_ / name).c_str(), flags | O_CLOEXEC, 0600));
    EXPECT_TRUE(opened) << name;
    return opened;
  }
  static std::pair<UniqueFd, UniqueFd> makePipe() {
    std::array<int, 2> ends{-1, -1};
    EXPECT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    return {UniqueFd(ends[0]), UniqueFd(ends[1])};
  }
  static std::pair<UniqueFd, UniqueFd> makeSockets() {
    std::array<int, 2> ends{-1, -1};
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()), 0);
    return {UniqueFd(ends[0]), UniqueFd(ends[1])};
  }
  Result<std::uint64_t> copy(const UniqueFd &from, const UniqueFd &to) {
    return ContentCopy{from.get(), to.get(), "the source", "the target"}.run(waiting_, [this](std::uint64_t bytes) {
      EXPECT_GT(bytes, progress_);
      progress_ = bytes;
    });
  }
  /// Writes everything and closes, on another thread.
  static std::jthread feed(UniqueFd to, std::string bytes) {
    return std::jthread([to = std::move(to), bytes = std::move(bytes)] {
      for (std::size_t at = 0; at < bytes.size();) {
        const ssize_t count = ::write(to.get(), bytes.data() + at, std::min<std::size_t>(bytes.size() - at, 10'000));
        if (count <= 0) return;
        at += static_cast<std::size_t>(count);
      }
    });
  }
  /// Reads to the end, on another thread.
  static std::jthread drain(UniqueFd from, std::string &bytes) {
    return std::jthread([from = std::move(from), &bytes] {
      std::array<char, 4096> buffer{};
      for (ssize_t count = 0; (count = ::read(from.get(), buffer.data(), buffer.size())) > 0;) {
        bytes.append(buffer.data(), static_cast<std::size_t>(count));
      }
    });
  }
  static std::string manyBytes() {
    std::string bytes(3'000'001, 'x');
    for (std::size_t i = 0; i < bytes.size(); i += 97) bytes[i] = static_cast<char>(i);
    return bytes;
  }

  TemporaryDirectory directory_;
  SteppedWaiting waiting_;
  std::uint64_t progress_ = 0;
};

TEST_F(ContentCopyTest, FileToFile) {
  const std::string bytes = manyBytes();
  directory_.write("from", bytes);
  EXPECT_EQ(copy(file("from", O_RDONLY), file("to", O_WRONLY | O_CREAT)).value(), bytes.size());
  EXPECT_EQ(directory_.read("to"), bytes);
  EXPECT_EQ(progress_, bytes.size());
}

TEST_F(ContentCopyTest, EmptyFile) {
  directory_.write("from", "");
  EXPECT_EQ(copy(file("from", O_RDONLY), file("to", O_WRONLY | O_CREAT)).value(), 0U);
  EXPECT_EQ(directory_.read("to"), "");
}

TEST_F(ContentCopyTest, AppendsToAFileOpenedForThat) {
  directory_.write("from", "new");
  directory_.write("to", "old ");
  EXPECT_EQ(copy(file("from", O_RDONLY), file("to", O_WRONLY | O_APPEND)).value(), 3U);
  EXPECT_EQ(directory_.read("to"), "old new");
}

TEST_F(ContentCopyTest, AFileWhoseSizeTheKernelDoesNotTell) {
  const UniqueFd version(::open("/proc/version", O_RDONLY | O_CLOEXEC));
  EXPECT_GT(copy(version, file("to", O_WRONLY | O_CREAT)).value(), 0U);
  EXPECT_THAT(directory_.read("to"), HasSubstr("Linux"));
}

TEST_F(ContentCopyTest, PipesOnEitherSide) {
  const std::string bytes = manyBytes();
  auto in = makePipe();
  auto out = makePipe();
  std::string arrived;
  {
    const auto feeding = feed(std::move(in.second), bytes);
    const auto draining = drain(std::move(out.first), arrived);
    EXPECT_EQ(copy(in.first, out.second).value(), bytes.size());
    out.second.reset();
  }
  EXPECT_EQ(arrived, bytes);
}

TEST_F(ContentCopyTest, FileToPipeAndPipeToFile) {
  const std::string bytes = manyBytes();
  directory_.write("from", bytes);
  auto pipe = makePipe();
  std::string arrived;
  {
    const auto draining = drain(std::move(pipe.first), arrived);
    EXPECT_EQ(copy(file("from", O_RDONLY), pipe.second).value(), bytes.size());
    pipe.second.reset();
  }
  EXPECT_EQ(arrived, bytes);
  progress_ = 0;
  auto back = makePipe();
  const auto feeding = feed(std::move(back.second), bytes);
  EXPECT_EQ(copy(back.first, file("to", O_WRONLY | O_CREAT)).value(), bytes.size());
  EXPECT_EQ(directory_.read("to"), bytes);
}

TEST_F(ContentCopyTest, SocketsThatDoNotBlock) {
  const std::string bytes = manyBytes();
  directory_.write("from", bytes);
  auto sockets = makeSockets();
  ASSERT_EQ(::fcntl(sockets.second.get(), F_SETFL, O_NONBLOCK), 0);
  std::string arrived;
  {
    const auto draining = drain(std::move(sockets.first), arrived);
    EXPECT_EQ(copy(file("from", O_RDONLY), sockets.second).value(), bytes.size());
    sockets.second.reset();
  }
  EXPECT_EQ(arrived, bytes);
}

TEST_F(ContentCopyTest, AReaderThatHasGoneIsABrokenPipe) {
  directory_.write("from", manyBytes());
  auto pipe = makePipe();
  pipe.first.reset();
  EXPECT_EQ(copy(file("from", O_RDONLY), pipe.second).error().code(), EPIPE);
  auto sockets = makeSockets();
  sockets.first.reset();
  EXPECT_EQ(copy(file("from", O_RDONLY), sockets.second).error().code(), EPIPE);
}

TEST_F(ContentCopyTest, TheSideThatFailsIsNamed) {
  const UniqueFd directory(::open(directory_.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const auto unreadable = copy(directory, file("to", O_WRONLY | O_CREAT));
  EXPECT_EQ(unreadable.error().code(), EISDIR);
  EXPECT_THAT(unreadable.error().message(), HasSubstr("reading the source"));
  directory_.write("from", "x");
  const auto unwritable = copy(file("from", O_RDONLY), file("to", O_RDONLY));
  EXPECT_EQ(unwritable.error().code(), EBADF);
  EXPECT_THAT(unwritable.error().message(), HasSubstr("writing the target"));
  const UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
  EXPECT_EQ(copy(file("from", O_RDONLY), full).error().code(), ENOSPC);
}

TEST_F(ContentCopyTest, AnInterruptionEndsWaitingForEitherSide) {
  const auto in = makePipe();
  std::jthread interrupting([this] { waiting_.interrupt(); });
  EXPECT_TRUE(isClientError(copy(in.first, file("to", O_WRONLY | O_CREAT)).error(), ClientErrorCode::cancelled));
  directory_.write("from", manyBytes());
  EXPECT_TRUE(isClientError(copy(file("from", O_RDONLY), in.second).error(), ClientErrorCode::cancelled));
  EXPECT_TRUE(isClientError(copy(file("from", O_RDONLY), file("to", O_WRONLY)).error(), ClientErrorCode::cancelled));
}

TEST_F(ContentCopyTest, AFullPipeIsWaitedForInterruptibly) {
  directory_.write("from", manyBytes());
  const auto pipe = makePipe();
  // Interrupts once the pipe is full.
  Result<std::uint64_t> copied = ContentCopy{file("from", O_RDONLY).release(), pipe.second.get(), "a", "b"}.run(
      waiting_,
      [this, capacity = static_cast<std::uint64_t>(::fcntl(pipe.second.get(), F_GETPIPE_SZ))](std::uint64_t bytes) {
        if (bytes >= capacity) waiting_.interrupt();
      });
  EXPECT_TRUE(isClientError(copied.error(), ClientErrorCode::cancelled));
}

}  // namespace
}  // namespace storix::ctl
