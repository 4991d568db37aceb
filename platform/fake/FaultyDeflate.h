// Deflate whose every call can be made to fail, for the failure paths of payload compression. In front of a
// real one it passes on what is not told to fail; alone it "compresses" by copying. Set the faults before
// streams are made; one thread.
#pragma once

#include <deque>
#include <optional>

#include "platform/Deflate.h"
#include "platform/base/Function.h"

namespace kyt {

class FaultyDeflate : public Deflate {
 public:
  struct Faults {
    std::optional<int> initialize;  // the result of initialize(), which then does nothing else
    std::deque<int> finish;         // the results of the next calls of finish(), which then do nothing else
    std::optional<size_t> bound;    // what bound() returns
    Function<void()> beforeFinish;  // called by each finish()
    const char* message = nullptr;  // what message() returns, if not null
    bool noStream = false;          // newStream() returns null
  };
  struct Calls {
    int streams = 0;
    int initialized = 0;
    int finished = 0;
    int ended = 0;
    int level = 0;  // of the last initialize()
    int windowBits = 0;
    int memoryLevel = 0;
  };

  explicit FaultyDeflate(Deflate* inner = nullptr) : inner_(inner) {}
  [[nodiscard]] std::unique_ptr<DeflateStream> newStream() override;
  void standInFrontOf(Deflate& inner) { inner_ = &inner; }

  Faults faults;
  Calls calls;

 private:
  Deflate* inner_;
};

}  // namespace kyt
