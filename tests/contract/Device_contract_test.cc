#include <thread>

#include "tests/contract/ContractTest.h"

namespace storix::contract {
namespace {

class DeviceContract : public ContractTest {};

constexpr const char *firstUnlock = "com.tessel.mobile.vaultkeepd.first_unlock";

TEST_P(DeviceContract, DeviceHasNoPasscodeUntilSomebodySaysSo) { EXPECT_EQ(platform().deviceLockState(), 3); }

TEST_P(DeviceContract, LockStateIsTheOneOfNow) {
  host().setLockState(1, false);
  EXPECT_EQ(platform().deviceLockState(), 1);
  EXPECT_FALSE(platform().deviceUnlockedSinceBoot());
  host().setLockState(0, true);
  EXPECT_EQ(platform().deviceLockState(), 0);
  EXPECT_TRUE(platform().deviceUnlockedSinceBoot());
  host().setLockState(3, false);
  EXPECT_EQ(platform().deviceLockState(), 3);
}

TEST_P(DeviceContract, NotificationIsDeliveredToEachObserverOnTheEventLoopEveryTime) {
  struct Seen {
    int first = 0;
    int second = 0;
    int other = 0;
    std::vector<std::thread::id> threads;
  };
  Awaited<Seen> seen;
  platform().addSystemNotificationObserver(firstUnlock, [&seen] {
    seen.change([](Seen &s) {
      ++s.first;
      s.threads.push_back(std::this_thread::get_id());
    });
  });
  platform().addSystemNotificationObserver(firstUnlock, [&seen] { seen.change([](Seen &s) { ++s.second; }); });
  platform().addSystemNotificationObserver("org.sample.other", [&seen] { seen.change([](Seen &s) { ++s.other; }); });
  runEventLoopDuring([this, &seen] {
    host().postNotification("org.sample.unobserved");
    host().postNotification(firstUnlock);
    EXPECT_TRUE(seen.wait([](const Seen &s) { return s.first == 1 && s.second == 1; }));
    host().postNotification(firstUnlock);
    EXPECT_TRUE(seen.wait([](const Seen &s) { return s.first == 2 && s.second == 2; }));
  });
  EXPECT_EQ(seen.value().other, 0);
  EXPECT_EQ(seen.value().threads, std::vector(2, std::this_thread::get_id()));
}

TEST_P(DeviceContract, NotificationFromBeforeTheEventLoopIsDeliveredOnceItRuns) {
  Awaited<int> count;
  platform().addSystemNotificationObserver(firstUnlock, [&count] { count.change([](int &c) { ++c; }); });
  host().postNotification(firstUnlock);
  runEventLoopDuring([&count] { EXPECT_TRUE(count.wait([](int c) { return c == 1; })); });
}

TEST_P(DeviceContract, ObserverMayObserveMore) {
  Awaited<int> count;
  platform().addSystemNotificationObserver("org.sample.first", [this, &count] {
    platform().addSystemNotificationObserver("org.sample.second", [&count] { count.change([](int &c) { c += 10; }); });
    count.change([](int &c) { ++c; });
  });
  runEventLoopDuring([this, &count] {
    host().postNotification("org.sample.first");
    EXPECT_TRUE(count.wait([](int c) { return c == 1; }));
    host().postNotification("org.sample.second");
    EXPECT_TRUE(count.wait([](int c) { return c == 11; }));
  });
}

STORIX_CONTRACT(DeviceContract);

}  // namespace
}  // namespace storix::contract
