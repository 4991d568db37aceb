// What every UserDefaults promises, on the one in memory that other tests use and on the files.
#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "platform/fake/FakeUserDefaults.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

struct InMemory {
  FakeUserDefaults defaults;
};

struct InFiles {
  TemporaryFolder folder;
  MemoryLogSink sink;
  Log log{sink};
  Counters counters;
  ManualClock clock;
  TomlUserDefaults defaults{{folder.path()}, log, counters, clock};
};

template <typename Adapter>
class UserDefaultsContract : public testing::Test {
 protected:
  Adapter adapter_;
  UserDefaults& defaults_ = adapter_.defaults;
};
using Adapters = testing::Types<InMemory, InFiles>;
TYPED_TEST_SUITE(UserDefaultsContract, Adapters);

TYPED_TEST(UserDefaultsContract, AKeyWithoutAValueIsNull) {
  EXPECT_TRUE(this->defaults_.value("domain", "key").isNull());
}

TYPED_TEST(UserDefaultsContract, ValuesKeepTheirKind) {
  const Value values[] = {Value("text"), Value(""),   Value(true), Value(false),
                          Value(-5),     Value(0.25), Value(3.0)};
  for (const Value& value : values) {
    ASSERT_EQ(this->defaults_.set("domain", "key", value), std::nullopt);
    const Value stored = this->defaults_.value("domain", "key");
    EXPECT_EQ(stored, value);
    EXPECT_EQ(stored.kind(), value.kind());
  }
}

TYPED_TEST(UserDefaultsContract, DomainsAndKeysAreApart) {
  ASSERT_EQ(this->defaults_.set("a", "key", Value(1)), std::nullopt);
  ASSERT_EQ(this->defaults_.set("b", "key", Value(2)), std::nullopt);
  ASSERT_EQ(this->defaults_.set("a", "other", Value(3)), std::nullopt);
  EXPECT_EQ(this->defaults_.value("a", "key"), Value(1));
  EXPECT_EQ(this->defaults_.value("b", "key"), Value(2));
  EXPECT_EQ(this->defaults_.value("a", "other"), Value(3));
}

TYPED_TEST(UserDefaultsContract, NullRemovesAKey) {
  ASSERT_EQ(this->defaults_.set("domain", "key", Value(1)), std::nullopt);
  ASSERT_EQ(this->defaults_.set("domain", "key", Value()), std::nullopt);
  EXPECT_TRUE(this->defaults_.value("domain", "key").isNull());
  EXPECT_EQ(this->defaults_.set("domain", "key", Value()), std::nullopt);
}

TYPED_TEST(UserDefaultsContract, StringOrStoreKeepsAStringAndReplacesAnythingElse) {
  EXPECT_EQ(this->defaults_.stringOrStore("domain", "key", String("first")), "first");
  EXPECT_EQ(this->defaults_.stringOrStore("domain", "key", String("second")), "first");
  ASSERT_EQ(this->defaults_.set("domain", "key", Value(7)), std::nullopt);
  EXPECT_EQ(this->defaults_.stringOrStore("domain", "key", String("third")), "third");
  EXPECT_EQ(this->defaults_.value("domain", "key"), Value("third"));
}

TYPED_TEST(UserDefaultsContract, ThreadsThatStoreTheSameKeyAgree) {
  std::vector<String> answers(4);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < answers.size(); ++i) {
    threads.emplace_back([this, i, &answers] {
      answers[i] = this->defaults_.stringOrStore("domain", "uuid:a:b", String(std::to_string(i).c_str()));
      for (int n = 0; n < 20; ++n) {
        (void)this->defaults_.value("domain", "uuid:a:b");
        (void)this->defaults_.set("domain", std::to_string(i), Value(n));
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  for (const String& answer : answers) EXPECT_EQ(answer, answers[0]);
  for (size_t i = 0; i < answers.size(); ++i)
    EXPECT_EQ(this->defaults_.value("domain", std::to_string(i)), Value(19));
}

}  // namespace
}  // namespace kyt
