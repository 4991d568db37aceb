#include "platform/fake/FaultyDeflate.h"

#include <algorithm>
#include <cstring>

namespace kyt {
namespace {

constexpr int kOK = 0;
constexpr int kStreamEnd = 1;

class CopyingStream : public DeflateStream {
 public:
  int initialize(int, int, int) override { return kOK; }
  size_t bound(size_t inputLength) override { return inputLength; }
  int finish(std::span<const std::byte>& input, std::span<std::byte>& output) override {
    const size_t count = std::min(input.size(), output.size());
    if (count != 0) std::memcpy(output.data(), input.data(), count);
    input = input.subspan(count);
    output = output.subspan(count);
    return input.empty() ? kStreamEnd : kOK;
  }
  void end() override {}
  [[nodiscard]] const char* message() const override { return nullptr; }
};

class FaultyStream : public DeflateStream {
 public:
  FaultyStream(std::unique_ptr<DeflateStream> inner, FaultyDeflate& owner)
      : inner_(std::move(inner)), owner_(owner) {}

  int initialize(int level, int windowBits, int memoryLevel) override {
    ++owner_.calls.initialized;
    owner_.calls.level = level;
    owner_.calls.windowBits = windowBits;
    owner_.calls.memoryLevel = memoryLevel;
    return owner_.faults.initialize ? *owner_.faults.initialize
                                    : inner_->initialize(level, windowBits, memoryLevel);
  }
  size_t bound(size_t inputLength) override {
    return owner_.faults.bound ? *owner_.faults.bound : inner_->bound(inputLength);
  }
  int finish(std::span<const std::byte>& input, std::span<std::byte>& output) override {
    ++owner_.calls.finished;
    if (owner_.faults.beforeFinish) owner_.faults.beforeFinish();
    if (owner_.faults.finish.empty()) return inner_->finish(input, output);
    const int result = owner_.faults.finish.front();
    owner_.faults.finish.pop_front();
    return result;
  }
  void end() override {
    ++owner_.calls.ended;
    inner_->end();
  }
  [[nodiscard]] const char* message() const override {
    return owner_.faults.message != nullptr ? owner_.faults.message : inner_->message();
  }

 private:
  std::unique_ptr<DeflateStream> inner_;
  FaultyDeflate& owner_;
};

}  // namespace

std::unique_ptr<DeflateStream> FaultyDeflate::newStream() {
  if (faults.noStream) return nullptr;
  ++calls.streams;
  std::unique_ptr<DeflateStream> inner =
      inner_ != nullptr ? inner_->newStream() : std::make_unique<CopyingStream>();
  return std::make_unique<FaultyStream>(std::move(inner), *this);
}

}  // namespace kyt
