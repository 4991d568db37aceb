// Storebags on their way to a server: publishing one, and telling beforehand what it changes.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <thread>

#include "config/StorebagGuard.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/LinuxClock.h"
#include "tools/Publication.h"
#include "tools/StorebagDiff.h"
#include "tools/kytctl/StorebagServices.h"

namespace kyt::tools {

namespace {

// "dulvek" of "bags/dulvek.toml".
std::string nameOf(const PublishOptions& options) {
  return options.name.empty() ? std::filesystem::path(options.sign.bag).stem().string() : options.name;
}

// The serial of what the folder hands out under that name now.
std::optional<int64_t> serialBefore(StorebagServices& services, const std::string& file) {
  auto document = readFile(file);
  if (std::holds_alternative<Error>(document)) return std::nullopt;
  const auto bag = services.file.open(std::get<std::string>(document), std::nullopt);
  const Dictionary* contents = std::get_if<Dictionary>(&bag);
  return contents != nullptr ? storebagSerial(*contents) : std::nullopt;
}

// A bag without a serial of its own gets the time, which grows by itself, whatever folder it goes to.
std::optional<std::string> giveSerial(Dictionary& bag, std::optional<int64_t> before, int64_t now) {
  if (!bag.contains(kStorebagSerial)) {
    bag.set(kStorebagSerial, std::max(now, before.value_or(0) + 1));
    return std::nullopt;
  }
  const std::optional<int64_t> serial = storebagSerial(bag);
  if (!serial) return "the bag's \"serial\" is no whole number";
  if (before && *serial <= *before)
    return "the bag's serial is " + std::to_string(*serial) + ", what is published has " +
           std::to_string(*before) + ": devices that refuse older bags would refuse it";
  return std::nullopt;
}

// Until the second is over that servers tell of the document: what is published next, into another folder too, has another
// time then and another serial, or a device that moves between the two would be told that nothing has changed. Not where
// that second lies far ahead.
void waitUntilAfter(int64_t second) {
  const TimeValue now = LinuxClock().timeOfDay();
  if (second != now.seconds) return;
  std::this_thread::sleep_for(std::chrono::microseconds(1'000'000 - now.microseconds));
}

}  // namespace

int publishCommand(const PublishOptions& options) {
  StorebagServices services;
  const std::string name = nameOf(options);
  if (name.empty() || name.find('/') != std::string::npos || name.starts_with('.'))
    return failed("\"" + name + "\" is no name of a storebag");
  auto bag = bagToSign(services, options.sign);
  if (auto* error = std::get_if<Error>(&bag)) return failed(*error);
  Dictionary& contents = std::get<Dictionary>(bag);
  const int64_t now = LinuxClock().timeOfDay().seconds;
  if (const auto wrong = giveSerial(contents, serialBefore(services, options.folder + "/" + name), now))
    return failed(*wrong);
  auto document = signedWith(services, options.sign, contents);
  if (auto* error = std::get_if<Error>(&document)) return failed(*error);
  auto done = publish(std::get<std::string>(document), options.folder, name, now);
  if (auto* error = std::get_if<Error>(&done)) return failed(*error);
  const Publication& made = std::get<Publication>(done);
  std::printf("%s: version %s, serial %s\n", escapedText(made.file).c_str(),
              escapedText(description(*contents.find("version"))).c_str(),
              description(*contents.find(kStorebagSerial)).c_str());
  if (!made.kept.empty()) std::printf("the one before: %s\n", escapedText(made.kept).c_str());
  if (made.isAhead)
    std::fprintf(
        stderr,
        "warning: its time is %lld s ahead, since the one before was that new: some servers hide that\n",
        static_cast<long long>(made.modified - now));
  std::fflush(stdout);
  waitUntilAfter(made.modified);
  return 0;
}

int diffCommand(const std::string& before, const std::string& after) {
  StorebagServices services;
  auto old = services.file.openOrRead(before);
  if (auto* error = std::get_if<Error>(&old)) return failed(*error);
  auto now = services.file.openOrRead(after);
  if (auto* error = std::get_if<Error>(&now)) return failed(*error);
  const auto changes = storebagChanges(std::get<Dictionary>(old), std::get<Dictionary>(now));
  for (const std::string& line : changes) std::printf("%s\n", escapedText(line).c_str());
  if (changes.empty()) std::printf("nothing changes\n");
  return 0;
}

}  // namespace kyt::tools
