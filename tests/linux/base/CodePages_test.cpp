#include "platform/linux/base/CodePages.h"

#include <gtest/gtest.h>
#include <link.h>

#include <fstream>
#include <string>
#include <thread>

#include "platform/linux/base/SharedLibrary.h"

namespace kyt {
namespace {

size_t residentFilePages() {
  std::ifstream status("/proc/self/status");
  size_t kibibytes = 0;
  for (std::string key; status >> key;)
    if (key == "RssFile:") status >> kibibytes;
  return kibibytes;
}

// Reads a byte of each page of all code, so that it is resident.
int touch(dl_phdr_info* object, size_t, void* sum) {
  if (std::string_view(object->dlpi_name).starts_with("linux-")) return 0;
  for (size_t i = 0; i < object->dlpi_phnum; ++i) {
    const auto& header = object->dlpi_phdr[i];
    if (header.p_type != PT_LOAD || (header.p_flags & PF_X) == 0) continue;
    const auto* bytes = reinterpret_cast<const volatile char*>(object->dlpi_addr + header.p_vaddr);
    for (size_t at = 0; at < header.p_filesz; at += 4096) *static_cast<long*>(sum) += bytes[at];
  }
  return 0;
}

TEST(CodePages, TheProcessHoldsLessAndGoesOn) {
  SharedLibrary library("libz.so.1");
  unsigned long (*checksum)(unsigned long, const unsigned char*, unsigned) = nullptr;
  library.resolve(checksum, "crc32");
  ASSERT_FALSE(library.problem());
  const auto* digits = reinterpret_cast<const unsigned char*>("123456789");
  EXPECT_EQ(checksum(0, digits, 9), 0xcbf43926u);

  long sum = 0, again = 0;
  dl_iterate_phdr(touch, &sum);
  const size_t before = residentFilePages();
  EXPECT_GT(giveBackCodePages(), 100000u);
  const size_t after = residentFilePages();
  EXPECT_LT(after, before);
  EXPECT_EQ(checksum(0, digits, 9), 0xcbf43926u);
  dl_iterate_phdr(touch, &again);
  EXPECT_EQ(again, sum);
}

TEST(CodePages, OthersMayRunMeanwhile) {
  std::thread giving([] {
    for (int i = 0; i < 50; ++i) static_cast<void>(giveBackCodePages());
  });
  std::string text;
  for (int i = 0; i < 2000; ++i) text = std::to_string(i) + text.substr(0, 100);
  giving.join();
  EXPECT_EQ(text.substr(0, 8), "19991998");
}

}  // namespace
}  // namespace kyt
