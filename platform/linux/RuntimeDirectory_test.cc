#include "platform/linux/RuntimeDirectory.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

namespace storix::linuxhost {
namespace {

namespace fs = std::filesystem;
using testing::AllOf;
using testing::HasSubstr;

class RuntimeDirectoryTest : public testing::Test {
 protected:
  RuntimeDirectoryTest() {
    std::string pattern = (fs::temp_directory_path() / "storix-runtime.XXXXXX").string();
    base_ = ::mkdtemp(pattern.data());
    path_ = (base_ / "run").string();
  }
  ~RuntimeDirectoryTest() override { fs::remove_all(base_); }

  /// The sentence by which the directory is refused; empty when it is not.
  static std::string refusalOf(const std::string &path) {
    const auto opened = RuntimeDirectory::open(path);
    return opened ? std::string() : opened.error().message();
  }

  fs::path base_;
  std::string path_;
};

TEST_F(RuntimeDirectoryTest, MissingDirectoryIsMadeForItsUserAlone) {
  const auto opened = RuntimeDirectory::open(path_ + "/");
  ASSERT_TRUE(opened.ok()) << opened.error().message();
  EXPECT_EQ(opened.value()->path(), path_);
  struct stat status {};
  ASSERT_EQ(::stat(path_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0700U);
  EXPECT_EQ(::faccessat(opened.value()->fd(), std::string(lockFileName).c_str(), F_OK, 0), 0);
}

TEST_F(RuntimeDirectoryTest, ExistingDirectoryIsUsedAsItIs) {
  fs::create_directory(path_);
  ::chmod(path_.c_str(), 0700);
  std::ofstream(path_ + "/something") << "kept";
  EXPECT_EQ(refusalOf(path_), "");
  EXPECT_TRUE(fs::exists(path_ + "/something"));
}

TEST_F(RuntimeDirectoryTest, DirectoryThatLetsOthersInIsRefused) {
  fs::create_directory(path_);
  ::chmod(path_.c_str(), 0750);
  EXPECT_THAT(refusalOf(path_), AllOf(HasSubstr("lets other users in"), HasSubstr("0750"), HasSubstr("chmod 700")));
}

TEST_F(RuntimeDirectoryTest, DirectoryThatKeepsItsUserOutIsRefused) {
  fs::create_directory(path_);
  ::chmod(path_.c_str(), 0500);
  EXPECT_THAT(refusalOf(path_), HasSubstr("keeps its own user out"));
}

TEST_F(RuntimeDirectoryTest, FileInItsPlaceIsRefused) {
  std::ofstream(path_) << "x";
  EXPECT_THAT(refusalOf(path_), HasSubstr("is not a directory"));
}

TEST_F(RuntimeDirectoryTest, SymbolicLinkInItsPlaceIsRefusedEvenWithASlashBehindIt) {
  fs::create_directory(base_ / "real");
  ::chmod((base_ / "real").c_str(), 0700);
  fs::create_directory_symlink(base_ / "real", path_);
  EXPECT_THAT(refusalOf(path_), HasSubstr("symbolic link"));
  EXPECT_THAT(refusalOf(path_ + "/"), HasSubstr("symbolic link"));
}

TEST_F(RuntimeDirectoryTest, DirectoryOfAnotherUserIsRefused) {
  // Some directory that is not ours: root's for everybody, and for root one that it gives away.
  std::string foreign = "/";
  if (::geteuid() == 0) {
    fs::create_directory(path_);
    ASSERT_EQ(::chown(path_.c_str(), 12345, 12345), 0);
    foreign = path_;
  }
  EXPECT_THAT(refusalOf(foreign), AllOf(HasSubstr("belongs to another user"), HasSubstr("STORIX_RUNTIME_DIR")));
}

TEST_F(RuntimeDirectoryTest, MissingParentIsSaid) {
  EXPECT_THAT(refusalOf((base_ / "no/run").string()), AllOf(HasSubstr("cannot be made"), HasSubstr("No such file")));
}

TEST_F(RuntimeDirectoryTest, SecondDaemonIsToldWhoHoldsIt) {
  auto first = RuntimeDirectory::open(path_);
  ASSERT_TRUE(first.ok());
  EXPECT_THAT(refusalOf(path_),
              AllOf(HasSubstr("in use by another storixd"), HasSubstr("process " + std::to_string(::getpid()))));
  first.value().reset();
  EXPECT_EQ(refusalOf(path_), "");
}

TEST_F(RuntimeDirectoryTest, LockThatIsNoFileIsRefusedWithoutWaiting) {
  fs::create_directory(path_);
  ::chmod(path_.c_str(), 0700);
  fs::create_symlink("/dev/null", path_ + "/" + std::string(lockFileName));
  EXPECT_THAT(refusalOf(path_), HasSubstr("remove that file"));
}

/// Takes what is "handed over" in a child process, where the descriptors from 3 on can be arranged, and
/// gives the child's exit status.
template <class Arrange, class Check>
int inActivatedChild(const char *names, int count, Arrange arrange, Check check) {
  const pid_t child = ::fork();
  if (child == 0) {
    ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
    ::setenv("LISTEN_FDS", std::to_string(count).c_str(), 1);
    ::setenv("LISTEN_FDNAMES", names, 1);
    arrange();
    ::_exit(check(takeActivatedSockets()) ? 0 : 1);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

void putListeningSocketAt(int fd) {
  const int made = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;  // An autobound abstract name.
  if (::bind(made, reinterpret_cast<const sockaddr *>(&address), sizeof address.sun_family) != 0 ||
      ::listen(made, 1) != 0) {
    ::_exit(2);
  }
  if (made != fd) {
    ::dup2(made, fd);
    ::close(made);
  }
}

TEST(ActivatedSocketsTest, NothingHandedOverGivesNone) {
  const auto sockets = takeActivatedSockets();
  ASSERT_TRUE(sockets.ok());
  EXPECT_TRUE(sockets.value().empty());
}

TEST(ActivatedSocketsTest, SocketsAreTakenByTheirNamesOnce) {
  EXPECT_EQ(0, inActivatedChild(
                   "com.tessel.Platform:com.tessel.Storix", 2,
                   [] {
                     putListeningSocketAt(3);
                     putListeningSocketAt(4);
                   },
                   [](const Result<ActivatedSockets> &sockets) {
                     if (!sockets.ok() || sockets.value().size() != 2) return false;
                     const auto service = sockets.value().find("com.tessel.Storix");
                     const auto again = takeActivatedSockets();
                     return service != sockets.value().end() && service->second.get() == 4 &&
                            (::fcntl(4, F_GETFD) & FD_CLOEXEC) != 0 && again.ok() && again.value().empty();
                   }));
}

TEST(ActivatedSocketsTest, WhatIsNoListeningSocketIsRefused) {
  EXPECT_EQ(0, inActivatedChild(
                   "com.tessel.Storix", 1, [] { ::dup2(::open("/dev/null", O_RDONLY), 3); },
                   [](const Result<ActivatedSockets> &sockets) {
                     return !sockets.ok() &&
                            sockets.error().message().find("no listening unix stream socket") != std::string::npos;
                   }));
}

TEST(ActivatedSocketsTest, TwoSocketsWithOneNameAreRefused) {
  EXPECT_EQ(0, inActivatedChild(
                   "com.tessel.Storix:com.tessel.Storix", 2,
                   [] {
                     putListeningSocketAt(3);
                     putListeningSocketAt(4);
                   },
                   [](const Result<ActivatedSockets> &sockets) {
                     return !sockets.ok() && sockets.error().message().find("two sockets") != std::string::npos;
                   }));
}

}  // namespace
}  // namespace storix::linuxhost
