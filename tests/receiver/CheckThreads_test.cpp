#include "receiver/CheckThreads.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>

#include "platform/fake/ManualClock.h"
#include "receiver/Limits.h"
#include "tests/support/Eventually.h"

namespace kyt::receiver {
namespace {

// Posts of which the large ones stand still on their thread until they are let go.
class ChecksTest : public ::testing::Test {
 protected:
  ~ChecksTest() override { isLetGo_ = true; }

  // One that has so many bytes once it is opened.
  void submit(uint64_t opened, size_t sent = 1000) {
    CheckThreads::Work work;
    work.bytes = sent;
    work.look = [this, opened](uint64_t mostBytes) {
      if (opened > mostBytes) return false;
      const bool isLarge = opened > Limits::checkSizes[0];
      if (isLarge) ++begun_;
      while (isLarge && !isLetGo_) std::this_thread::yield();
      ++(isLarge ? large_ : small_);
      return true;
    };
    work.refuse = [this] { ++refused_; };
    checks_->submit(std::move(work));
  }

  static constexpr uint64_t kLarge = 64 << 20;
  std::atomic<bool> isLetGo_{false};
  std::atomic<int> small_{0}, large_{0}, begun_{0}, refused_{0};
  ManualClock clock_;
  std::unique_ptr<CheckThreads> checks_ = std::make_unique<CheckThreads>(clock_);
};

TEST_F(ChecksTest, ThatAreLargeHoldUpNoSmallOnes) {
  for (int i = 0; i < 32; ++i) submit(kLarge);
  for (int i = 0; i < 100; ++i) submit(1000);
  EXPECT_TRUE(eventually([&] { return small_ == 100; }));
  EXPECT_EQ(large_, 0);
  isLetGo_ = true;
  EXPECT_TRUE(eventually([&] { return large_ == 32; }));
  EXPECT_EQ(refused_, 0);
}

TEST_F(ChecksTest, ThatAreVeryLargeHoldUpNoLargeOnes) {
  submit(kLarge);
  ASSERT_TRUE(eventually([&] { return begun_ == 1; }));
  submit(2 << 20);
  EXPECT_TRUE(eventually([&] { return begun_ == 2; }));
}

TEST_F(ChecksTest, ThatAreLargeAreRefusedWhereTooManyBytesWait) {
  submit(kLarge);
  ASSERT_TRUE(eventually([&] { return begun_ == 1; }));
  const int fit = static_cast<int>(Limits::maxWaitingCheckBytes >> 20);
  for (int i = 0; i < fit + 3; ++i) submit(kLarge, 1 << 20);
  EXPECT_TRUE(eventually([&] { return refused_ == 3; }));
  isLetGo_ = true;
  EXPECT_TRUE(eventually([&] { return large_ == fit + 1; }));
  EXPECT_EQ(refused_, 3);
}

TEST_F(ChecksTest, ThatHaveWaitedTooLongAreRefused) {
  submit(kLarge);
  ASSERT_TRUE(eventually([&] { return begun_ == 1; }));
  submit(kLarge);
  submit(1000);
  ASSERT_TRUE(eventually([&] { return small_ == 1; }));
  clock_.advance(Limits::checkTime + std::chrono::milliseconds(1));
  isLetGo_ = true;
  EXPECT_TRUE(eventually([&] { return refused_ == 1; }));
  EXPECT_TRUE(eventually([&] { return large_ == 1; })) << "whose look had begun in time";
}

TEST_F(ChecksTest, AreAllDoneAtTheEnd) {
  for (int i = 0; i < 10; ++i) submit(i % 2 == 0 ? kLarge : 10);
  isLetGo_ = true;
  checks_.reset();
  EXPECT_EQ(small_ + large_ + refused_, 10);
}

}  // namespace
}  // namespace kyt::receiver
