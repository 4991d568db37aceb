#include "platform/linux/base/LineWriter.h"

#include <limits.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <deque>
#include <string_view>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/base/ConditionVariable.h"
#include "platform/base/Mutex.h"
#include "platform/linux/base/Threads.h"

namespace kyt {
namespace {

constexpr Duration kLastPatience = std::chrono::seconds(1);

bool isRegularFile(int descriptor) {
  struct stat status = {};
  return ::fstat(descriptor, &status) == 0 && S_ISREG(status.st_mode);
}

}  // namespace

struct LineWriter::State {
  State(int which, LineWriterOptions how)
      : descriptor(which), neverFull(isRegularFile(which)), options(std::move(how)) {}

  // Whether so much as write() is given here can be written without waiting.
  [[nodiscard]] bool hasRoom() const {
    if (neverFull) return true;
    pollfd writable = {descriptor, POLLOUT, 0};
    // True also where it is closed or has no reader left: then writing fails at once.
    return ::poll(&writable, 1, 0) > 0;
  }
  // What is left of the line: it stops where writing would wait. What fails is lost, unless somebody else can take it.
  [[nodiscard]] std::string_view writeWhatHasRoom(const std::string& line) const REQUIRES(mutex) {
    std::string_view text = line;
    bool wasRefused = false;
    while (!text.empty() && hasRoom()) {
      const size_t most = options.datagrams ? text.size() : PIPE_BUF;
      const ssize_t count = ::write(descriptor, text.data(), std::min(text.size(), most));
      if (count < 0 && errno == EINTR) continue;
      if (count < 0 && errno == EAGAIN) return text;
      if (count < 0) {
        const bool lastTime = std::exchange(wasRefused, true);
        if (!options.refused || !options.refused(line, lastTime) || lastTime) return {};
        continue;
      }
      text.remove_prefix(static_cast<size_t>(count));
    }
    return text;
  }
  void put(std::string line) REQUIRES(mutex);
  void takeFirst() REQUIRES(mutex);
  void flush() REQUIRES(mutex);
  void tellDropped() REQUIRES(mutex);
  void drain();

  const int descriptor;
  const bool neverFull;
  Mutex mutex;
  LineWriterOptions options GUARDED_BY(mutex);
  ConditionVariable drained;
  std::deque<std::string> lines GUARDED_BY(mutex);  // the first one may have been written in part
  size_t bytes GUARDED_BY(mutex) = 0;
  unsigned long long droppedLines GUARDED_BY(mutex) = 0;  // not told yet
  bool mayHaveThread GUARDED_BY(mutex) = false;
  bool draining GUARDED_BY(mutex) = false;  // by the thread, which alone writes then
};

void LineWriter::State::put(std::string line) {
  if (bytes + line.size() > options.maxQueuedBytes) {
    ++droppedLines;
    if (options.dropped) options.dropped();
    return;
  }
  bytes += line.size();
  lines.push_back(std::move(line));
}

void LineWriter::State::takeFirst() {
  bytes -= lines.front().size();
  lines.pop_front();
}

void LineWriter::State::tellDropped() {
  if (droppedLines == 0 || !lines.empty()) return;
  const auto count = std::exchange(droppedLines, 0);
  if (options.lineAboutDropped) put(options.lineAboutDropped(count));
}

void LineWriter::State::flush() {
  while (!lines.empty()) {
    const size_t left = writeWhatHasRoom(lines.front()).size();
    if (left != 0) {
      bytes -= lines.front().size() - left;
      lines.front().erase(0, lines.front().size() - left);
      return;
    }
    takeFirst();
    tellDropped();
  }
}

// The thread's: waits for the reader.
void LineWriter::State::drain() {
  beginServiceThread("kyt-log");
  mutex.lock();
  while (!lines.empty()) {
    mutex.unlock();
    pollfd writable = {descriptor, POLLOUT, 0};
    (void)::poll(&writable, 1, -1);
    mutex.lock();
    flush();
  }
  draining = false;
  drained.notifyAll();
  mutex.unlock();
}

LineWriter::LineWriter(int descriptor, LineWriterOptions options)
    : state_(std::make_shared<State>(descriptor, std::move(options))) {}

LineWriter::~LineWriter() {
  const MonotonicTime end = std::chrono::steady_clock::now() + kLastPatience;
  MutexLock lock(state_->mutex);
  if (!state_->draining) state_->flush();
  while (state_->draining && state_->drained.waitUntil(state_->mutex, end)) {
  }
  state_->options.dropped = nullptr;  // what they use may end now
  state_->options.refused = nullptr;
}

void LineWriter::allowThread() {
  MutexLock lock(state_->mutex);
  state_->mayHaveThread = true;
}

void LineWriter::write(std::string line) {
  State& state = *state_;
  MutexLock lock(state.mutex);
  state.put(std::move(line));
  if (state.draining) return;
  state.flush();
  if (state.lines.empty() || !state.mayHaveThread) return;
  try {
    state.draining = true;
    std::thread([shared = state_] { shared->drain(); }).detach();
  } catch (const std::system_error&) {
    state.draining = false;  // with the next line again
  }
}

}  // namespace kyt
