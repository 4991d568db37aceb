// The network thread ("kyt-network") and what other threads ask of it. The thread runs the event loop over the sockets of
// all connection pools, their time-outs and the kernel's news of routes; what becomes of the requests is decided in
// URLRequests.
//
// Other threads submit commands, with a short lock and one wake-up for each burst. The thread is started by
// the first command and ended by stop(). Held by the factory and by every session, so that a session may
// outlive the factory.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "platform/base/ConditionVariable.h"
#include "platform/base/Descriptor.h"
#include "platform/base/Mutex.h"
#include "platform/linux/url/Completions.h"
#include "platform/linux/url/NetworkTools.h"
#include "platform/linux/url/URLRequests.h"

namespace kyt {

class URLNetwork {
 public:
  URLNetwork(CurlURLSessionOptions options, Log& log, Counters& counters);
  URLNetwork(const URLNetwork&) = delete;
  URLNetwork& operator=(const URLNetwork&) = delete;

  // Any thread.
  void start(std::shared_ptr<URLTransfer> transfer);
  void cancel(std::shared_ptr<URLTransfer> transfer);
  void invalidate(std::shared_ptr<URLSessionState> session);
  void cancelAwaited();
  void cancelAll();
  void reconfigure(CurlURLSessionFactory::Access access);
  void watchConnectivity(std::shared_ptr<Function<void()>> changed) {
    requests_.watchConnectivity(std::move(changed));
  }
  // Cancels what is left, and ends the threads; false when completions still run after `patience`. Once, not from a
  // thread of this network.
  [[nodiscard]] bool stopWithin(Duration patience);
  void stop();  // the same, however long it takes, also after the other
  void completionHasRun();
  [[nodiscard]] URLFigures figures() const { return tools_.figures.now(); }
  [[nodiscard]] size_t outstanding() const { return outstanding_.load(); }

  // The network thread's, for transfers.
  [[nodiscard]] NetworkTools& tools() { return tools_; }
  [[nodiscard]] URLRequests& requests() { return requests_; }

 private:
  enum class Kind : uint8_t { start, cancel, invalidate };
  struct Command {
    Kind kind;
    std::shared_ptr<URLTransfer> transfer;
    std::shared_ptr<URLSessionState> session;
  };

  void submit(Command command);
  void insistOnTheThread();
  void wakeUp();
  [[nodiscard]] bool startThread() REQUIRES(mutex_);
  void run();
  [[nodiscard]] int waitingTime() const;
  void handleEvent(uint64_t which, uint32_t events);
  void takeCommands();
  void wakeSockets() { tools_.sockets.wake(); }

  // Self-synchronised.
  std::atomic<size_t> outstanding_{0};

  Mutex mutex_;
  Descriptor epoll_, wake_;  // written with the mutex held, before there is the thread
  std::vector<Command> commands_ GUARDED_BY(mutex_);
  std::optional<CurlURLSessionFactory::Access> access_ GUARDED_BY(mutex_);  // to be taken up
  bool running_ GUARDED_BY(mutex_) = false;
  bool stopping_ GUARDED_BY(mutex_) = false;
  bool threadEnds_ GUARDED_BY(mutex_) = false;  // nothing is left for it to do
  std::thread thread_ GUARDED_BY(mutex_);
  ConditionVariable changed_;  // the thread ends, or nothing is outstanding any more

  // The network thread's.
  NetworkTools tools_;
  Completions completions_;
  URLRequests requests_;
  std::vector<Command> taken_;
  Deadline rest_;  // of sockets that can be written to in vain
};

}  // namespace kyt
