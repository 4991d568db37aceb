// Objects whose memory the system refuses: what the program set for that is called, and then it is tried again.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <fstream>
#include <functional>
#include <new>
#include <string>

#include "platform/objects/DictionaryIndex.h"
#include "platform/objects/Value.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

constexpr size_t kLarge = size_t{64} << 20;
constexpr size_t kSpare = size_t{4} << 20;  // less than any of the blocks below

int refusals = 0;

void limitAddresses(rlim_t bytes) {
  rlimit limit = {};
  ::getrlimit(RLIMIT_AS, &limit);
  limit.rlim_cur = bytes;
  ::setrlimit(RLIMIT_AS, &limit);
}

rlim_t addressesInUse() {
  rlim_t pages = 0;
  std::ifstream("/proc/self/statm") >> pages;
  return pages * static_cast<rlim_t>(::sysconf(_SC_PAGESIZE));
}

// How often memory was refused while `work` was done, by a system that has a little more until it is asked again.
std::string refusalsOf(const std::function<void()>& work) {
  limitAddresses(addressesInUse() + kSpare);
  std::set_new_handler([] {
    ++refusals;
    limitAddresses(RLIM_INFINITY);
  });
  try {
    work();
  } catch (const std::bad_alloc&) {
    return "std::bad_alloc after " + std::to_string(refusals);
  }
  return std::to_string(refusals);
}

std::string refusalsInChild(const std::function<void()>& work) {
  return inChildProcess([&] { return refusalsOf(work); });
}

// More entries than are looked through one by one, with room for a million.
Dictionary withLargeIndex() {
  Dictionary dictionary;
  dictionary.reserve(size_t{1} << 20);
  for (size_t i = 0; i <= detail::kMaxScanned; ++i) dictionary.set(String(std::to_string(i)), Value(1));
  return dictionary;
}

class RefusedMemory : public testing::Test {
 protected:
  void SetUp() override {
    if (kSanitized) GTEST_SKIP() << "a sanitizer takes more address space than any limit";
  }
};

TEST_F(RefusedMemory, OfAStringIsAskedForAgain) {
  const std::string text(kLarge, 'x');
  EXPECT_EQ(refusalsInChild([&] { EXPECT_EQ(String(text).size(), kLarge); }), "1");
}

TEST_F(RefusedMemory, OfDataIsAskedForAgain) {
  EXPECT_EQ(refusalsInChild([] {
              std::byte* bytes = nullptr;
              EXPECT_EQ(Data::uninitialized(kLarge, bytes).size(), kLarge);
            }),
            "1");
}

TEST_F(RefusedMemory, OfAnArrayIsAskedForAgain) {
  EXPECT_EQ(refusalsInChild([] { Array().reserve(kLarge / sizeof(Value)); }), "1");
}

TEST_F(RefusedMemory, OfADictionaryIsAskedForAgain) {
  EXPECT_EQ(refusalsInChild([] { Dictionary().reserve(kLarge / sizeof(DictionaryEntry)); }), "1");
}

TEST_F(RefusedMemory, OfADictionarysIndexIsAskedForAgain) {
  EXPECT_EQ(inChildProcess([] {
              Dictionary dictionary;
              dictionary.reserve(size_t{1} << 20);
              dictionary.set("first", Value(1));
              return refusalsOf([&] {
                for (size_t i = 0; i <= detail::kMaxScanned; ++i)
                  dictionary.set(String(std::to_string(i)), Value(1));
              });
            }),
            "1");
}

TEST_F(RefusedMemory, OfAnIndexThatIsCopiedIsAskedForAgain) {
  const Dictionary original = withLargeIndex();
  EXPECT_EQ(refusalsInChild([&] {
              Dictionary copy = original;
              EXPECT_TRUE(copy.remove("0"));
            }),
            "1");
}

TEST_F(RefusedMemory, EndsInAnExceptionWhereNothingIsSetForThat) {
  EXPECT_EQ(inChildProcess([]() -> std::string {
              limitAddresses(addressesInUse() + kSpare);
              std::set_new_handler(nullptr);
              try {
                Array().reserve(kLarge / sizeof(Value));
              } catch (const std::bad_alloc&) {
                return "thrown";
              }
              return "not thrown";
            }),
            "thrown");
}

}  // namespace
}  // namespace kyt
