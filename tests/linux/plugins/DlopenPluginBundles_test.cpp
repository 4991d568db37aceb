// Plug-ins as shared objects: what is found in them by name, and which of them are not trusted.
#include "platform/linux/plugins/DlopenPluginBundles.h"

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "platform/base/Blocking.h"
#include "platform/fake/MemoryLogSink.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr char kBundle[] = "/System/Test.framework";
constexpr char kOperation[] = "sendMessageWithMethod:respCode:dict:";

// As the plug-in has it.
struct Record {
  int objects;
  unsigned method, respCode;
  size_t length;
  char json[512];
};

class PluginTest : public testing::Test {
 protected:
  std::string install(const std::string& library = KYT_TEST_PLUGIN, mode_t mode = 0644) const {
    const std::string file = folder_ / "System/Test.framework/Test.so";
    std::filesystem::create_directories(folder_ / "System/Test.framework");
    std::filesystem::copy_file(library, file, std::filesystem::copy_options::overwrite_existing);
    ::chmod(file.c_str(), mode);
    return file;
  }
  // What the loaded plug-in kept.
  static Record& record(const std::string& file) {
    void* library = ::dlopen(file.c_str(), RTLD_NOW | RTLD_NOLOAD);
    EXPECT_NE(library, nullptr);
    auto* found = static_cast<Record*>(::dlsym(library, "test_record"));
    ::dlclose(library);
    return *found;
  }
  bool refused(std::string_view why) const {
    return sink_.contains(LogLevel::error, "DlopenPluginBundles(load): Cannot load " +
                                               (folder_ / "System/Test.framework/Test.so") + ": " +
                                               std::string(why));
  }

  const TemporaryFolder folder_;
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  DlopenPluginBundles bundles_{folder_.path(), log_};
};

TEST_F(PluginTest, AMissingBundleIsNoneUntilItIsThere) {
  EXPECT_EQ(bundles_.bundleWithPath(kBundle), nullptr);
  std::filesystem::create_directories(folder_ / "System/Test.framework");
  EXPECT_EQ(bundles_.bundleWithPath(kBundle), nullptr);
  EXPECT_TRUE(sink_.lines().empty());
  install();
  EXPECT_NE(bundles_.bundleWithPath(kBundle), nullptr);
}

TEST_F(PluginTest, FindsClassesOnlyOnceLoaded) {
  install();
  const auto bundle = bundles_.bundleWithPath(kBundle);
  ASSERT_NE(bundle, nullptr);
  EXPECT_FALSE(bundle->isLoaded());
  EXPECT_EQ(bundle->classNamed("QDXAdaptor"), nullptr);
  EXPECT_TRUE(bundle->load());
  EXPECT_TRUE(bundle->isLoaded());
  EXPECT_NE(bundle->classNamed("QDXAdaptor"), nullptr);
  EXPECT_EQ(bundle->classNamed("Another"), nullptr);
  EXPECT_EQ(bundle->classNamed(""), nullptr);
  EXPECT_EQ(bundles_.bundleWithPath(kBundle), bundle);
  EXPECT_TRUE(bundle->load());
}

TEST_F(PluginTest, CallsAnObjectsOperationByItsName) {
  const std::string file = install();
  const auto bundle = bundles_.bundleWithPath(kBundle);
  ASSERT_TRUE(bundle->load());
  auto object = bundle->classNamed("QDXAdaptor")->newInstance();
  ASSERT_NE(object, nullptr);
  Record& kept = record(file);
  EXPECT_EQ(kept.objects, 1);
  EXPECT_EQ(object->description(), "the test's adaptor");
  EXPECT_FALSE(object->respondsTo("sendMessageWithMethod:respCode:"));
  EXPECT_FALSE(object->respondsTo("another:"));
  ASSERT_TRUE(object->respondsTo(kOperation));
  const Dictionary dictionary{{"text", "a\"\n\xc3\xa9"},
                              {"date", Date{0}},
                              {"data", Data(std::string_view("\x01\xff"))},
                              {"inner", Dictionary{{"list", Array{1, true, 2.5}}}}};
  object->invoke(kOperation, 65535, 404, dictionary);
  EXPECT_EQ(kept.method, 65535u);
  EXPECT_EQ(kept.respCode, 404u);
  EXPECT_EQ(std::string(kept.json),
            "{\"text\":\"a\\\"\\n\xc3\xa9\",\"date\":\"1970-01-01 00:00:00 +0000\",\"data\":\"<01ff>\","
            "\"inner\":{\"list\":[1,true,2.5]}}");
  EXPECT_EQ(kept.length, std::string(kept.json).size());
  object.reset();
  EXPECT_EQ(kept.objects, 0);
}

TEST_F(PluginTest, LookingForItLoadingAndEachCallAreAnnouncedAsWaits) {
  struct Observer final : BlockingObserver {
    void willBlock(BlockingKind) override { ++waits; }
    void hasBlocked() override { ++ends; }
    int waits = 0, ends = 0;
  } observer;
  install();
  BlockingObserver* const former = BlockingObserver::exchange(&observer);
  const auto bundle = bundles_.bundleWithPath(kBundle);
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(observer.waits, 1);
  EXPECT_EQ(bundles_.bundleWithPath(kBundle), bundle);
  EXPECT_EQ(observer.waits, 1) << "it is known";
  EXPECT_TRUE(bundle->load());
  EXPECT_EQ(observer.waits, 2);
  EXPECT_TRUE(bundle->load());
  EXPECT_EQ(observer.waits, 2) << "it is loaded";
  const auto adaptor = bundle->classNamed("QDXAdaptor");
  auto object = adaptor->newInstance();
  EXPECT_EQ(observer.waits, 3);
  object->invoke(kOperation, 1, 2, {});
  EXPECT_EQ(observer.waits, 4);
  EXPECT_EQ(object->description(), "the test's adaptor");
  EXPECT_EQ(observer.waits, 5);
  object.reset();
  EXPECT_EQ(observer.waits, 6);
  EXPECT_EQ(observer.ends, 6);
  BlockingObserver::exchange(former);
}

TEST_F(PluginTest, WhatAClassLeavesOutIsMadeUpFor) {
  install();
  const auto bundle = bundles_.bundleWithPath(kBundle);
  ASSERT_TRUE(bundle->load());
  const auto plain = bundle->classNamed("Plain")->newInstance();
  ASSERT_NE(plain, nullptr);
  EXPECT_EQ(plain->description(), "<Plain>");
  EXPECT_FALSE(plain->respondsTo(kOperation));
  EXPECT_EQ(bundle->classNamed("Failing")->newInstance(), nullptr);
}

TEST_F(PluginTest, APluginForOtherRulesIsRefused) {
  install(KYT_TEST_PLUGIN_OTHER_ABI);
  const auto bundle = bundles_.bundleWithPath(kBundle);
  EXPECT_FALSE(bundle->load());
  EXPECT_FALSE(bundle->isLoaded());
  EXPECT_TRUE(refused("was not built for this version of plug-ins"));
}

TEST_F(PluginTest, WhatIsNoSharedObjectIsRefused) {
  folder_.write("System/Test.framework/Test.so", "not one");
  EXPECT_FALSE(bundles_.bundleWithPath(kBundle)->load());
  EXPECT_TRUE(refused(folder_ / "System/Test.framework/Test.so"));
}

TEST_F(PluginTest, AFileThatOthersCanWriteIsRefused) {
  for (const mode_t mode : {0664, 0646}) {
    install(KYT_TEST_PLUGIN, mode);
    EXPECT_FALSE(bundles_.bundleWithPath(kBundle)->load());
  }
  EXPECT_TRUE(refused("can be written by others"));
  install();
  EXPECT_TRUE(bundles_.bundleWithPath(kBundle)->load());
}

TEST_F(PluginTest, AFileOfAnotherUserIsRefused) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give a file away";
  const std::string file = install();
  ASSERT_EQ(::chown(file.c_str(), 54321, 0), 0);
  EXPECT_FALSE(bundles_.bundleWithPath(kBundle)->load());
  EXPECT_TRUE(refused("belongs to another user"));
}

TEST_F(PluginTest, AFolderInItsPlaceIsRefused) {
  std::filesystem::create_directories(folder_ / "System/Test.framework/Test.so");
  EXPECT_FALSE(bundles_.bundleWithPath(kBundle)->load());
  EXPECT_TRUE(refused("is no regular file"));
}

}  // namespace
}  // namespace kyt
