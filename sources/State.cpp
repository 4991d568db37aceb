#include "sources/State.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>

#include "platform/linux/files/Files.h"

namespace kyt::sources {

namespace {

constexpr size_t kMostBytes = 4096;

}  // namespace

std::optional<State> readState(const std::string& path) {
  const auto read = readRegularFile(path, kMostBytes);
  const auto* file = std::get_if<FileContents>(&read);
  if (file == nullptr) return std::nullopt;
  const std::string& text = file->bytes;
  const size_t line = text.find('\n');
  if (line == std::string::npos || text.back() != '\n') return std::nullopt;
  const size_t end = text.find('\n', line + 1);
  if (end == std::string::npos) return std::nullopt;
  State state;
  const auto number = std::from_chars(text.data(), text.data() + line, state.report);
  if (number.ec != std::errc() || number.ptr != text.data() + line) return std::nullopt;
  state.position = text.substr(line + 1, end - line - 1);
  if (end == text.size() - 1) return state;
  if (text.find('\n', end + 1) != text.size() - 1) return std::nullopt;
  state.until = text.substr(end + 1, text.size() - end - 2);
  return state;
}

State stateAtStart(const std::string& path, std::chrono::seconds since1970, std::string& problem) {
  if (auto state = readState(path)) return *std::move(state);
  if (::access(path.c_str(), F_OK) == 0)
    problem = path + " cannot be read as a state: what was told is not known, and reports are numbered anew";
  const auto day = std::chrono::floor<std::chrono::days>(since1970);
  State state;
  state.report = std::max<uint64_t>(1, static_cast<uint64_t>(std::chrono::seconds(day).count()));
  return state;
}

std::optional<std::string> writeState(const std::string& path, const State& state) {
  const std::string fresh = path + ".new";
  const auto failed = [&](int error) { return "can't write " + path + ": " + errorText(error); };
  {
    const Descriptor file =
        ownDescriptor(::open(fresh.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0600));
    if (!file) return failed(errno);
    std::string text = std::to_string(state.report) + "\n" + state.position + "\n";
    if (!state.until.empty()) text += state.until + "\n";
    if (!writeAll(file.get(), text) || ::fsync(file.get()) != 0) return failed(errno);
  }
  if (std::rename(fresh.c_str(), path.c_str()) != 0) return failed(errno);
  return std::nullopt;
}

}  // namespace kyt::sources
