#include "platform/ProcessScope.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "platform/fake/FakePlatform.h"

namespace storix {
namespace {

class ProcessScopeTest : public testing::Test {
 protected:
  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
};

TEST_F(ProcessScopeTest, ScopeIsInPlaceAsLongAsItLives) {
  EXPECT_EQ(ProcessScope::currentOrNull(), nullptr);
  {
    ProcessScope scope(*platform_);
    EXPECT_EQ(&ProcessScope::current(), &scope);
    EXPECT_EQ(&ProcessScope::current().platform(), platform_.get());
  }
  EXPECT_EQ(ProcessScope::currentOrNull(), nullptr);
}

TEST_F(ProcessScopeTest, InstanceIsMadeOnceAScope) {
  int made = 0;
  const auto make = [&made] { return std::make_shared<int>(++made); };
  {
    ProcessScope scope(*platform_);
    EXPECT_EQ(*scope.instance<int>(make), 1);
    EXPECT_EQ(*scope.instance<int>(make), 1);
  }
  ProcessScope scope(*platform_);
  EXPECT_EQ(*scope.instance<int>(make), 2);
}

TEST_F(ProcessScopeTest, InstancesOfDifferentTypesAreDifferent) {
  ProcessScope scope(*platform_);
  EXPECT_EQ(*scope.instance<int>([] { return std::make_shared<int>(1); }), 1);
  EXPECT_EQ(*scope.instance<std::string>([] { return std::make_shared<std::string>("one"); }), "one");
}

TEST_F(ProcessScopeTest, InstanceMayBeMadeFromAnother) {
  ProcessScope scope(*platform_);
  const auto text = scope.instance<std::string>([&scope] {
    return std::make_shared<std::string>(*scope.instance<int>([] { return std::make_shared<int>(1); }), 'x');
  });
  EXPECT_EQ(*text, "x");
}

TEST_F(ProcessScopeTest, ConcurrentFirstCallersGetTheSameOne) {
  ProcessScope scope(*platform_);
  std::atomic<int> made{0};
  std::vector<std::shared_ptr<int>> got(8);
  {
    std::vector<std::jthread> threads;
    threads.reserve(got.size());
    for (std::shared_ptr<int> &slot : got) {
      threads.emplace_back(
          [&slot, &scope, &made] { slot = scope.instance<int>([&made] { return std::make_shared<int>(++made); }); });
    }
  }
  EXPECT_EQ(made, 1);
  for (const std::shared_ptr<int> &one : got) EXPECT_EQ(one, got.front());
}

TEST_F(ProcessScopeTest, ScopeIsStillInPlaceWhileItsObjectsGo) {
  struct Leaving {
    explicit Leaving(bool &s) : sawScope(s) {}
    ~Leaving() { sawScope = ProcessScope::currentOrNull() != nullptr; }
    bool &sawScope;
  };
  bool sawScope = false;
  {
    ProcessScope scope(*platform_);
    (void)scope.instance<Leaving>([&sawScope] { return std::make_shared<Leaving>(sawScope); });
  }
  EXPECT_TRUE(sawScope);
}

using ProcessScopeDeathTest = ProcessScopeTest;

TEST_F(ProcessScopeDeathTest, SecondScopeEndsTheProcess) {
  ProcessScope scope(*platform_);
  EXPECT_DEATH(ProcessScope second(*platform_), "second process scope");
}

TEST_F(ProcessScopeDeathTest, UseWithoutAScopeEndsTheProcess) {
  EXPECT_DEATH(ProcessScope::current(), "used before it was made");
}

}  // namespace
}  // namespace storix
