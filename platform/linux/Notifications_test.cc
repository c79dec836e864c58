#include "platform/linux/Notifications.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace storix::linuxhost {
namespace {

class NotificationsTest : public testing::Test {
 protected:
  NotificationsTest() : loop_(std::move(EventLoop::create().value())), notifications_(*loop_) {}

  /// Delivers what has been posted.
  void deliver() {
    loop_->post([] { ::kill(::getpid(), SIGTERM); });
    loop_->run();
  }

  std::unique_ptr<EventLoop> loop_;
  Notifications notifications_;
  std::vector<std::string> heard_;
};

TEST_F(NotificationsTest, EveryObserverOfTheNameHearsEveryDeliveryInOrder) {
  notifications_.addObserver("unlock", [this] { heard_.push_back("first"); });
  notifications_.addObserver("unlock", [this] { heard_.push_back("second"); });
  notifications_.addObserver("other", [this] { heard_.push_back("other"); });
  notifications_.post("unlock");
  notifications_.post("unlock");
  notifications_.post("nobody's");
  EXPECT_TRUE(heard_.empty());
  deliver();
  EXPECT_EQ(heard_, (std::vector<std::string>{"first", "second", "first", "second"}));
}

TEST_F(NotificationsTest, DeliveryIsOnTheLoopsThreadWhoeverPosts) {
  std::thread::id thread;
  notifications_.addObserver("unlock", [&thread] { thread = std::this_thread::get_id(); });
  std::thread([this] { notifications_.post("unlock"); }).join();
  deliver();
  EXPECT_EQ(thread, std::this_thread::get_id());
}

TEST_F(NotificationsTest, AnObserverMayObserveAndPostAgain) {
  notifications_.addObserver("unlock", [this] {
    heard_.push_back("unlock");
    notifications_.addObserver("later", [this] { heard_.push_back("later"); });
    notifications_.post("later");
  });
  notifications_.post("unlock");
  deliver();
  deliver();
  EXPECT_EQ(heard_, (std::vector<std::string>{"unlock", "later"}));
}

}  // namespace
}  // namespace storix::linuxhost
