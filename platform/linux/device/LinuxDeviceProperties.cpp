#include "platform/linux/device/LinuxDeviceProperties.h"

#include <sys/utsname.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <utility>

#include "platform/base/Hex.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

constexpr size_t kMaxPropertyFileBytes = 65536;

// This application's half of the machine id's HMAC. Another value would give every device a new identifier.
constexpr std::array<unsigned char, 16> kApplicationID = {0x6b, 0x1f, 0x0c, 0x52, 0x8e, 0x94, 0x4d, 0x37,
                                                          0xa1, 0x5d, 0x2e, 0x70, 0xc9, 0x63, 0xf8, 0x0a};

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kBlanks(" \t\r\n\0", 5);
  const size_t first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

std::optional<std::string> usable(std::string_view text) {
  text = trimmed(text);
  if (text.empty() || !isValidUTF8(text)) return std::nullopt;
  return std::string(text);
}

// A file of one value; the device tree's lists end each entry with a zero byte, the first entry counts.
std::optional<std::string> firstOf(const std::string& path) {
  auto contents = readRegularFile(path, kMaxPropertyFileBytes);
  const auto* found = std::get_if<FileContents>(&contents);
  if (found == nullptr) return std::nullopt;
  const std::string_view text = found->bytes;
  return usable(text.substr(0, text.find('\0')));
}

// What firmware vendors leave in fields that they never filled in is no answer.
std::optional<std::string> dmi(const std::string& path) {
  static constexpr std::string_view kPlaceholders[] = {"none",
                                                       "not specified",
                                                       "default string",
                                                       "to be filled by o.e.m.",
                                                       "system product name",
                                                       "not applicable",
                                                       "system serial number",
                                                       "o.e.m.",
                                                       "0123456789",
                                                       "type1productconfigid"};
  auto text = firstOf(path);
  if (!text) return std::nullopt;
  std::string lower = *text;
  std::transform(lower.begin(), lower.end(), lower.begin(),
                 [](unsigned char c) { return static_cast<char>(c >= 'A' && c <= 'Z' ? c + 32 : c); });
  for (std::string_view placeholder : kPlaceholders) {
    if (lower == placeholder) return std::nullopt;
  }
  return text;
}

// The value of a shell-like assignment, its quotes and backslashes taken away.
std::string unquoted(std::string_view text) {
  std::string out;
  char quote = 0;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '\\' && quote != '\'' && i + 1 < text.size()) {
      out += text[++i];
    } else if (quote == 0 && (c == '"' || c == '\'')) {
      quote = c;
    } else if (quote != 0 && c == quote) {
      quote = 0;
    } else {
      out += c;
    }
  }
  return out;
}

std::optional<std::string> assignment(const std::string& path, std::string_view key) {
  auto contents = readRegularFile(path, kMaxPropertyFileBytes);
  const auto* found = std::get_if<FileContents>(&contents);
  if (found == nullptr) return std::nullopt;
  std::string_view rest = found->bytes;
  std::optional<std::string> value;
  while (!rest.empty()) {
    const size_t end = std::min(rest.find('\n'), rest.size());
    const std::string_view line = trimmed(rest.substr(0, end));
    rest.remove_prefix(std::min(end + 1, rest.size()));
    if (!line.starts_with(key) || line.substr(key.size(), 1) != "=") continue;
    value = usable(unquoted(line.substr(key.size() + 1)));  // of several the last counts
  }
  return value;
}

std::optional<std::string> hostName() {
  char name[256] = {};
  if (::gethostname(name, sizeof name - 1) != 0) return std::nullopt;
  return usable(name);
}

std::optional<std::string> kernelRelease() {
  utsname names = {};
  if (::uname(&names) != 0) return std::nullopt;
  return usable(names.release);
}

std::string hexText(Bytes bytes) {
  std::string text;
  appendHex(bytes, text);
  return text;
}

std::array<std::byte, 32> hmacSHA256(Cryptography& cryptography, Bytes key, Bytes message) {
  std::array<std::byte, 64> block = {};
  std::copy(key.begin(), key.end(), block.begin());  // 16 bytes here
  const auto digest = [&](std::byte pad, Bytes bytes) {
    std::string input;
    for (std::byte byte : block) input += static_cast<char>(byte ^ pad);
    input.append(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    return cryptography.sha256(std::as_bytes(std::span(input)));
  };
  const auto inner = digest(std::byte{0x36}, message);
  return digest(std::byte{0x5C}, inner);
}

constexpr int64_t kOffsetBias = 1 << 22;  // makes every offset, at most days, positive in its 24 bits

}  // namespace

LinuxDeviceProperties::LinuxDeviceProperties(DeviceSources sources, Cryptography& cryptography, Log& log,
                                             const Clock& clock)
    : sources_(std::move(sources)),
      cryptography_(cryptography),
      log_(log),
      overrides_(sources_.overrides, clock) {}

std::optional<std::string> LinuxDeviceProperties::overridden(std::string_view key) {
  if (sources_.overrides.empty()) return std::nullopt;
  MutexLock lock(mutex_);
  std::optional<TomlError> problem;
  const FlatToml& content = overrides_.current(problem);
  if (problem) log_.error("deviceProperties: %s", problem->text.c_str());
  const Value value = content.value(key);
  if (value.isNull()) return std::nullopt;
  return description(value);
}

std::optional<std::string> LinuxDeviceProperties::uniqueDeviceID() {
  const auto text = firstOf(sources_.machineID);
  if (!text || text->size() != 32) return std::nullopt;
  std::array<std::byte, 16> id = {};
  for (size_t i = 0; i < id.size(); ++i) {
    const int high = hexDigit((*text)[2 * i]), low = hexDigit((*text)[2 * i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    id[i] = static_cast<std::byte>(high << 4 | low);
  }
  const auto digest = hmacSHA256(cryptography_, id, std::as_bytes(std::span(kApplicationID)));
  std::array<std::byte, 16> specific = {};
  std::copy_n(digest.begin(), specific.size(), specific.begin());
  specific[6] = (specific[6] & std::byte{0x0F}) | std::byte{0x40};
  specific[8] = (specific[8] & std::byte{0x3F}) | std::byte{0x80};
  const std::string specificText = hexText(specific);
  return hexText(cryptography_.sha1(std::as_bytes(std::span(specificText))));
}

std::optional<String> LinuxDeviceProperties::property(std::string_view key) {
  std::optional<std::string> value = overridden(key);
  const auto otherwise = [&value](auto&& source) {
    if (!value) value = source();
  };
  if (key == "ProductVersion") {
    otherwise([&] { return assignment(sources_.osRelease, "VERSION_ID"); });
  } else if (key == "BuildVersion") {
    otherwise([&] { return assignment(sources_.osRelease, "BUILD_ID"); });
    otherwise([&] { return assignment(sources_.osRelease, "IMAGE_VERSION"); });
    otherwise(kernelRelease);
  } else if (key == "ProductType") {
    otherwise([&] { return assignment(sources_.machineInfo, "HARDWARE_MODEL"); });
    otherwise([&] { return dmi(sources_.dmi + "/product_name"); });
    otherwise([&] { return firstOf(sources_.deviceTree + "/model"); });
  } else if (key == "DeviceName") {
    otherwise([&] { return assignment(sources_.machineInfo, "PRETTY_HOSTNAME"); });
    otherwise(hostName);
  } else if (key == "HWModelStr") {
    otherwise([&] { return dmi(sources_.dmi + "/board_name"); });
    otherwise([&] { return firstOf(sources_.deviceTree + "/compatible"); });
  } else if (key == "SerialNumber") {
    otherwise([&] { return dmi(sources_.dmi + "/product_serial"); });
    otherwise([&] { return firstOf(sources_.deviceTree + "/serial-number"); });
  } else if (key == "UniqueDeviceID") {
    otherwise([&] { return uniqueDeviceID(); });
  }
  if (!value) return std::nullopt;
  return String(std::string_view(*value));
}

std::optional<std::string> LinuxDeviceProperties::territory(std::string_view locale) {
  const size_t begin = locale.find('_');
  if (begin == std::string_view::npos || begin == 0) return std::nullopt;
  std::string_view territory = locale.substr(begin + 1);
  territory = territory.substr(0, territory.find_first_of(".@"));
  const bool letters = territory.size() == 2 && std::all_of(territory.begin(), territory.end(),
                                                            [](char c) { return c >= 'A' && c <= 'Z'; });
  const bool digits = territory.size() == 3 && std::all_of(territory.begin(), territory.end(),
                                                           [](char c) { return c >= '0' && c <= '9'; });
  if (!letters && !digits) return std::nullopt;  // two letters, or three digits of a region ("es_419")
  return std::string(territory);
}

std::optional<String> LinuxDeviceProperties::countryCode() {
  std::optional<std::string> country = overridden("country");
  if (!country) {
    const char* locale = std::getenv("LC_ALL");
    if (locale == nullptr || *locale == 0) locale = std::getenv("LANG");
    if (locale != nullptr) country = territory(locale);
  }
  if (!country || country->empty()) return std::nullopt;
  return String(std::string_view(*country));
}

int64_t LinuxDeviceProperties::secondsFromGMT(TimeValue time) {
  // Offsets change at whole minutes. The minute is kept in 40 bits, biased so that 0 stands for no look-up.
  const int64_t minute = (time.seconds >= 0 ? time.seconds : time.seconds - 59) / 60;
  const uint64_t wanted = static_cast<uint64_t>(minute + (int64_t{1} << 38)) & ((uint64_t{1} << 40) - 1);
  const uint64_t known = offset_.load(std::memory_order_relaxed);
  if (known != 0 && known >> 24 == wanted) return static_cast<int64_t>(known & 0xFFFFFF) - kOffsetBias;
  // One thread at a time: the C library has a lock of its own for this, but the thread sanitizer does not see
  // it.
  MutexLock lock(zoneMutex_);
  // Without TZ the C library looks here whether /etc/localtime is another file than before.
  ::tzset();
  const time_t seconds = time.seconds;
  tm local = {};
  if (::localtime_r(&seconds, &local) == nullptr) return 0;
  const int64_t offset = local.tm_gmtoff;
  offset_.store(wanted << 24 | static_cast<uint64_t>(offset + kOffsetBias), std::memory_order_relaxed);
  return offset;
}

std::vector<std::string> devicePropertyKeys() {
  return {"ProductVersion", "BuildVersion",   "ProductType", "DeviceName", "HWModelStr",
          "SerialNumber",   "UniqueDeviceID", "ReleaseType", "country"};
}

uint64_t DefaultsDiagnosticsConsent::epoch() {
  const FileIdentity identity = identityOf(file_);
  constexpr uint64_t kPrime = 1099511628211U;
  uint64_t epoch = 14695981039346656037U;
  for (const auto part :
       {identity.inode, static_cast<uint64_t>(identity.size), static_cast<uint64_t>(identity.modifiedSeconds),
        static_cast<uint64_t>(identity.modifiedNanoseconds)})
    epoch = (epoch ^ part) * kPrime;
  return std::max<uint64_t>(epoch, 1);
}

}  // namespace kyt
