#include "platform/linux/device/LinuxDeviceProperties.h"

#include <gtest/gtest.h>
#include <openssl/sha.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <systemd/sd-id128.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <thread>
#include <vector>

#include "platform/fake/FakeUserDefaults.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/NoDescriptors.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

class Digests final : public Cryptography {
 public:
  std::array<std::byte, 20> sha1(Bytes bytes) override {
    std::array<std::byte, 20> out;
    ::SHA1(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(),
           reinterpret_cast<unsigned char*>(out.data()));
    return out;
  }
  std::array<std::byte, 32> sha256(Bytes bytes) override {
    std::array<std::byte, 32> out;
    ::SHA256(reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(),
             reinterpret_cast<unsigned char*>(out.data()));
    return out;
  }
  std::array<std::byte, 20> hmacSHA1(Bytes, Bytes) override { return {}; }
  std::unique_ptr<PublicKey> publicKeyFromDER(Bytes) override { return nullptr; }
};

class LinuxDevicePropertiesTest : public testing::Test {
 protected:
  LinuxDeviceProperties make() {
    return LinuxDeviceProperties({folder_ / "device.toml", folder_ / "os-release", folder_ / "machine-info",
                                  folder_ / "machine-id", folder_ / "dmi", folder_ / "tree"},
                                 digests_, log_, clock_);
  }
  std::string property(const char* key) {
    auto properties = make();
    const auto value = properties.property(key);
    return value ? std::string(value->view()) : "(none)";
  }
  TemporaryFolder folder_;
  MemoryLogSink sink_;
  Log log_{sink_};
  Digests digests_;
  ManualClock clock_;
};

TEST_F(LinuxDevicePropertiesTest, ReadsOsRelease) {
  folder_.write("os-release",
                "NAME=\"X\"\nVERSION_ID=\"12 \\\"a\\\"\"\nBUILD_ID='b1'\nIMAGE_VERSION=7\n#VERSION_ID=9\n");
  EXPECT_EQ(property("ProductVersion"), "12 \"a\"");
  EXPECT_EQ(property("BuildVersion"), "b1");
  folder_.write("os-release", "IMAGE_VERSION=7\n");
  EXPECT_EQ(property("ProductVersion"), "(none)");
  EXPECT_EQ(property("BuildVersion"), "7");
  folder_.write("os-release", "");
  EXPECT_NE(property("BuildVersion"), "(none)") << "the kernel's release is always there";
}

TEST_F(LinuxDevicePropertiesTest, ReadsMachineInfoBeforeFirmware) {
  EXPECT_EQ(property("ProductType"), "(none)");
  folder_.write("tree/model", std::string("Board X\0", 8));
  EXPECT_EQ(property("ProductType"), "Board X");
  folder_.write("dmi/product_name", "Laptop 5\n");
  EXPECT_EQ(property("ProductType"), "Laptop 5");
  folder_.write("machine-info", "HARDWARE_MODEL=Real\nPRETTY_HOSTNAME=\"Anna's \\$ device\"\n");
  EXPECT_EQ(property("ProductType"), "Real");
  EXPECT_EQ(property("DeviceName"), "Anna's $ device");
}

TEST_F(LinuxDevicePropertiesTest, TheHostNameIsTheDevicesNameOtherwise) {
  char name[256] = {};
  ASSERT_EQ(::gethostname(name, sizeof name - 1), 0);
  EXPECT_EQ(property("DeviceName"), name);
}

TEST_F(LinuxDevicePropertiesTest, ReadsDMIAndDeviceTree) {
  EXPECT_EQ(property("HWModelStr"), "(none)");
  EXPECT_EQ(property("SerialNumber"), "(none)");
  folder_.write("tree/compatible", std::string("vendor,board\0vendor,soc\0", 24));
  folder_.write("tree/serial-number", std::string("S-1\0", 4));
  EXPECT_EQ(property("HWModelStr"), "vendor,board");
  EXPECT_EQ(property("SerialNumber"), "S-1");
  folder_.write("dmi/board_name", "B7\n");
  folder_.write("dmi/product_serial", "  PF3  \n");
  EXPECT_EQ(property("HWModelStr"), "B7");
  EXPECT_EQ(property("SerialNumber"), "PF3");
}

TEST_F(LinuxDevicePropertiesTest, WhatFirmwareNeverFilledInIsNoAnswer) {
  for (const char* text : {"To Be Filled By O.E.M.\n", "Default string", "None", " \n", "\xff\xfe"}) {
    folder_.write("dmi/product_serial", text);
    EXPECT_EQ(property("SerialNumber"), "(none)") << text;
  }
}

TEST_F(LinuxDevicePropertiesTest, TheIdentifierIsTheDigestOfAnApplicationSpecificMachineID) {
  folder_.write("machine-id", "0123456789abcdef0123456789abcdef\n");
  const std::string id = property("UniqueDeviceID");
  // HMAC-SHA-256 and SHA-1 computed with another implementation.
  EXPECT_EQ(id, "383388926465c464359151c5dd080c79484b5a84");
  folder_.write("machine-id", "0123456789abcdef0123456789abcdee\n");
  EXPECT_NE(property("UniqueDeviceID"), id);
  for (const char* bad :
       {"", "uninitialized\n", "0123456789abcdef0123456789abcde\n", "0123456789abcdef0123456789abcdeg\n"}) {
    folder_.write("machine-id", bad);
    EXPECT_EQ(property("UniqueDeviceID"), "(none)") << bad;
  }
}

TEST_F(LinuxDevicePropertiesTest, TheApplicationSpecificMachineIDIsTheSystemLibrarys) {
  sd_id128_t specific;
  sd_id128_t application;
  ASSERT_EQ(::sd_id128_from_string("6b1f0c528e944d37a15d2e70c963f80a", &application), 0);
  if (::sd_id128_get_machine_app_specific(application, &specific) < 0) GTEST_SKIP() << "no machine id here";
  char text[SD_ID128_STRING_MAX];
  const std::string_view plain = ::sd_id128_to_string(specific, text);
  std::string expected;
  for (std::byte byte : digests_.sha1(std::as_bytes(std::span(plain)))) {
    char hex[3];
    std::snprintf(hex, sizeof hex, "%02x", static_cast<unsigned>(byte));
    expected += hex;
  }
  LinuxDeviceProperties properties(DeviceSources{}, digests_, log_, clock_);
  const auto id = properties.property("UniqueDeviceID");
  ASSERT_TRUE(id);
  EXPECT_EQ(*id, expected);
  EXPECT_EQ(id->size(), 40u);
}

TEST_F(LinuxDevicePropertiesTest, DeviceTomlOverridesEveryKeyAndIsReadAgain) {
  folder_.write("os-release", "VERSION_ID=1\n");
  auto properties = make();
  EXPECT_EQ(properties.property("ProductVersion"), String("1"));
  for (int i = 10; i < 60; ++i) {
    folder_.write("device.toml", "ProductVersion = \"" + std::to_string(i) + "\"\n");
    ASSERT_EQ(properties.property("ProductVersion"), String(std::to_string(i).c_str()));
  }
  for (const char* key :
       {"BuildVersion", "ProductType", "DeviceName", "HWModelStr", "SerialNumber", "UniqueDeviceID"}) {
    folder_.write("device.toml", std::string(key) + " = \"mine\"\n");
    EXPECT_EQ(properties.property(key), String("mine")) << key;
  }
}

TEST_F(LinuxDevicePropertiesTest, TheReleaseTypeComesFromDeviceTomlAlone) {
  folder_.write("os-release", "ReleaseType=Internal\n");
  EXPECT_EQ(property("ReleaseType"), "(none)");
  folder_.write("device.toml", "ReleaseType = \"Internal\"\n");
  EXPECT_EQ(property("ReleaseType"), "Internal");
  EXPECT_EQ(property("SomethingElse"), "(none)");
}

TEST_F(LinuxDevicePropertiesTest, ABadDeviceTomlIsToldOnceAndIgnored) {
  folder_.write("os-release", "VERSION_ID=1\n");
  folder_.write("device.toml", "ProductVersion = \n");
  auto properties = make();
  for (int i = 0; i < 3; ++i) EXPECT_EQ(properties.property("ProductVersion"), String("1"));
  EXPECT_EQ(sink_.count(LogLevel::error, "deviceProperties: " + (folder_ / "device.toml") + ":1: "), 1u);
  EXPECT_EQ(sink_.lines().size(), 1u);
}

TEST_F(LinuxDevicePropertiesTest, TheCountryIsTheLocalesTerritory) {
  const std::pair<const char*, const char*> locales[] = {
      {"de_DE.UTF-8", "DE"}, {"sr_RS@latin", "RS"}, {"es_419", "419"}, {"en_GB", "GB"}};
  for (const auto& [locale, country] : locales)
    EXPECT_EQ(LinuxDeviceProperties::territory(locale), country) << locale;
  for (const char* locale :
       {"", "C", "POSIX", "C.UTF-8", "de", "de.UTF-8", "_DE", "de_D", "de_de", "de_DEU"}) {
    EXPECT_EQ(LinuxDeviceProperties::territory(locale), std::nullopt) << locale;
  }
}

TEST_F(LinuxDevicePropertiesTest, TheCountryComesFromDeviceTomlThenLCAllThenLang) {
  const auto country = [&](const char* all, const char* lang) {
    return inChildProcess([&]() -> std::string {
      all != nullptr ? ::setenv("LC_ALL", all, 1) : ::unsetenv("LC_ALL");
      lang != nullptr ? ::setenv("LANG", lang, 1) : ::unsetenv("LANG");
      auto properties = make();
      const auto code = properties.countryCode();
      return code ? std::string(code->view()) : "(none)";
    });
  };
  EXPECT_EQ(country(nullptr, nullptr), "(none)");
  EXPECT_EQ(country(nullptr, "fr_CA.UTF-8"), "CA");
  EXPECT_EQ(country("", "fr_CA.UTF-8"), "CA");
  EXPECT_EQ(country("de_AT", "fr_CA"), "AT");
  EXPECT_EQ(country("C", "fr_CA"), "(none)");
  folder_.write("device.toml", "country = \"JP\"\n");
  EXPECT_EQ(country("de_AT", nullptr), "JP");
}

constexpr int64_t kSummerBegins = 1774746000;  // 2026-03-29 01:00 GMT

TEST_F(LinuxDevicePropertiesTest, TheOffsetFollowsDaylightSavingInBothDirections) {
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              ::setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);
              auto properties = make();
              std::string offsets;
              for (int64_t seconds : {-1, 0, 1, -1, 59, 60}) {
                offsets += std::to_string(properties.secondsFromGMT({kSummerBegins + seconds, 0})) + " ";
              }
              return offsets;
            }),
            "3600 7200 7200 3600 7200 7200 ");
}

TEST_F(LinuxDevicePropertiesTest, AChangeOfTheZoneCountsFromTheNextMinute) {
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              ::setenv("TZ", "XXX5:30", 1);
              auto properties = make();
              std::string offsets = std::to_string(properties.secondsFromGMT({60, 0})) + " ";
              ::setenv("TZ", "YYY-14", 1);
              offsets += std::to_string(properties.secondsFromGMT({119, 999999})) + " ";
              offsets += std::to_string(properties.secondsFromGMT({120, 0})) + " ";
              offsets += std::to_string(properties.secondsFromGMT({-1, 0})) + " ";
              return offsets + std::to_string(properties.secondsFromGMT({-61, 0}));
            }),
            "-19800 -19800 50400 50400 50400");
}

TEST_F(LinuxDevicePropertiesTest, ThreadsInDifferentMinutesGetTheirOwnOffsets) {
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              ::setenv("TZ", "CET-1CEST,M3.5.0,M10.5.0/3", 1);
              auto properties = make();
              std::atomic<int> wrong = 0;
              std::vector<std::thread> threads;
              for (int64_t side : {-1, 0}) {
                threads.emplace_back([&properties, &wrong, side] {
                  for (int i = 0; i < 2000; ++i) {
                    if (properties.secondsFromGMT({kSummerBegins + side, 0}) != (side < 0 ? 3600 : 7200))
                      ++wrong;
                  }
                });
              }
              for (std::thread& thread : threads) thread.join();
              return std::to_string(wrong);
            }),
            "0");
}

TEST_F(LinuxDevicePropertiesTest, AnotherLocaltimeFileCountsFromTheNextMinute) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /etc/localtime";
  const std::string zone = "/usr/share/zoneinfo/Asia/Kolkata";
  if (::access(zone.c_str(), R_OK) != 0 || ::access("/etc/localtime", R_OK) != 0)
    GTEST_SKIP() << "no zone files here";
  EXPECT_EQ(inChildProcess([&]() -> std::string {
              ::unsetenv("TZ");
              if (!unshareMounts()) return "skip";
              auto properties = make();
              const int64_t before = properties.secondsFromGMT({0, 0});
              if (::mount(zone.c_str(), "/etc/localtime", nullptr, MS_BIND, nullptr) != 0)
                return "mount failed";
              if (properties.secondsFromGMT({59, 0}) != before) return "changed within the minute";
              return std::to_string(properties.secondsFromGMT({1774746000, 0}));
            }),
            "19800");
}

TEST(DefaultsDiagnosticsConsent, HasAnotherEpochAfterItWasWithdrawnAndGivenAgain) {
  const TemporaryFolder folder;
  FakeUserDefaults defaults;
  DefaultsDiagnosticsConsent consent(defaults, folder / "consent.toml");
  const uint64_t none = consent.epoch();
  folder.write("consent.toml", "consent = true\n");
  const uint64_t first = consent.epoch();
  EXPECT_NE(first, none);
  EXPECT_EQ(consent.epoch(), first);
  folder.write("another.toml", "consent = true\n");
  std::filesystem::rename(folder / "another.toml", folder / "consent.toml");
  EXPECT_NE(consent.epoch(), first);
}

TEST(DefaultsDiagnosticsConsent, IsTheUserDefaultAndNoValueIsNo) {
  FakeUserDefaults defaults;
  DefaultsDiagnosticsConsent consent(defaults);
  EXPECT_FALSE(consent.isSubmissionAllowed());
  defaults.put("com.vantu.diagnostics", "consent", Value(true));
  EXPECT_TRUE(consent.isSubmissionAllowed());
  defaults.put("com.vantu.diagnostics", "consent", Value(false));
  EXPECT_FALSE(consent.isSubmissionAllowed());
  defaults.put("com.vantu.diagnostics", "consent", Value("yes"));
  EXPECT_TRUE(consent.isSubmissionAllowed());
}

TEST_F(LinuxDevicePropertiesTest, OverridesThatCannotBeOpenedForAMomentStay) {
  folder_.write("device.toml", "SerialNumber = \"S1\"\n");
  auto properties = make();
  ASSERT_EQ(properties.property("SerialNumber"), String("S1"));
  folder_.write("device.toml", "SerialNumber = \"S2\"\n");
  {
    const NoDescriptors none;
    EXPECT_EQ(properties.property("SerialNumber"), String("S1"));
  }
  EXPECT_EQ(sink_.count(LogLevel::error, "device.toml: Too many open files"), 1u);
  EXPECT_EQ(properties.property("SerialNumber"), String("S2"));
}

}  // namespace
}  // namespace kyt
