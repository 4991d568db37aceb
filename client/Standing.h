// Where a session stands, and who is told: the program by its block, and whoever set KYTREPORTING_DEBUG by lines
// on standard error.
//
// Threads: state() and why() any thread; everything else the library's thread, and where nothing runs for the session
// (any more), the thread that opens or closes it.
#pragma once

#include <atomic>
#include <deque>
#include <string>
#include <utility>

#include "client/LibraryThread.h"
#include "client/ProgramBlock.h"
#include "kytreporting/KYTReporting.h"
#include "platform/base/Mutex.h"

namespace kyt::client {

class Standing {
 public:
  using State = KYTReporting::State;
  using Block = Function<void(State, const std::string&)>;

  // `name` begins the lines on standard error: which session.
  Standing(std::string name, Block block);

  [[nodiscard]] State state() const { return state_.load(std::memory_order_acquire); }
  [[nodiscard]] std::string why() const;
  [[nodiscard]] bool debugs() const { return debugs_; }

  // Takes over the state and its reason; the block is told by the next announce() when either changed.
  void become(State state, std::string why) REQUIRES(libraryThread);
  // The same for a reason that is not worth telling.
  void note(State state, std::string why) REQUIRES(libraryThread);
  // Runs the block for what became. It may close the session.
  void announce() REQUIRES(libraryThread);
  void dropBlock() REQUIRES(libraryThread) { block_.drop(); }

  // Lines on standard error, if they are wanted; say() on any thread.
  void say(const std::string& text) const;
  void sayDrops(const KYTReporting::Statistics& figures) REQUIRES(libraryThread);

 private:
  const std::string name_;
  const bool debugs_;
  std::atomic<State> state_{State::noDaemon};
  mutable Mutex mutex_;
  std::string why_ GUARDED_BY(mutex_);
  ProgramBlock<State, const std::string&> block_ GUARDED_BY(libraryThread);
  std::deque<std::pair<State, std::string>> changes_ GUARDED_BY(libraryThread);
  std::string told_ GUARDED_BY(libraryThread);  // the last reason that was worth telling, with its state
  KYTReporting::Statistics said_ GUARDED_BY(libraryThread);
};

}  // namespace kyt::client
