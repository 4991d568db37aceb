#include "platform/linux/data/LinuxRandom.h"

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <set>
#include <string>

#include "platform/base/UUIDText.h"
#include "platform/fake/FixedRandom.h"

namespace kyt {
namespace {

// What every source of randomness promises, the fake one too.
class RandomSourceContract : public testing::TestWithParam<bool> {
 protected:
  std::unique_ptr<RandomSource> source = GetParam()
                                             ? std::unique_ptr<RandomSource>(std::make_unique<LinuxRandom>())
                                             : std::make_unique<FixedRandom>(41);
};

TEST_P(RandomSourceContract, DrawsBelowTheBound) {
  for (const uint32_t bound : {1U, 2U, 3U, 100U, 0x80000001U, UINT32_MAX})
    for (int i = 0; i < 100; ++i) EXPECT_LT(source->uniform(bound), bound);
}

TEST_P(RandomSourceContract, MakesDifferentUUIDsOfVersionFour) {
  std::set<std::string> seen;
  for (int i = 0; i < 100; ++i) {
    const std::string text = uuidText(source->uuidBytes());
    EXPECT_EQ(text.size(), 36U);
    EXPECT_EQ(text[14], '4');
    EXPECT_NE(std::string("89AB").find(text[19]), std::string::npos) << text;
    seen.insert(text);
  }
  EXPECT_EQ(seen.size(), 100U);
}

INSTANTIATE_TEST_SUITE_P(Sources, RandomSourceContract, testing::Values(true, false),
                         [](const auto& kind) { return kind.param ? "Linux" : "Fixed"; });

TEST(LinuxRandom, ReachesEveryResult) {
  LinuxRandom random;
  std::set<uint32_t> seen;
  for (int i = 0; i < 2000; ++i) seen.insert(random.uniform(10));  // misses one with a chance of 1 in 10^90
  EXPECT_EQ(seen.size(), 10U);
}

TEST(FixedRandom, AnswersTheDrawsItWasGiven) {
  FixedRandom random(7);
  random.queueDraws({3, 12});
  EXPECT_EQ(random.uniform(10), 3U);
  EXPECT_EQ(random.uniform(10), 2U);
  EXPECT_EQ(random.uniform(100), 7U);
  random.setDraw(9);
  EXPECT_EQ(random.uniform(100), 9U);
  EXPECT_EQ(random.bounds(), (std::vector<uint32_t>{10, 10, 100, 100}));
  EXPECT_EQ(uuidText(random.uuidBytes()), "00000000-0000-4000-8000-000000000001");
  EXPECT_EQ(random.uuidBytes(), FixedRandom::uuidNumber(2));
}

}  // namespace
}  // namespace kyt
