// A client's end of a stream in memory, and a reactor that reports what a test tells it: the IPC server
// without sockets and threads, for tests that need its turns one by one and for fuzzing.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>

#include "platform/Reactor.h"
#include "platform/Stream.h"

namespace kyt {

// What both ends see. One thread at a time.
struct MemoryPipe {
  std::string toServer, fromServer;
  size_t room = SIZE_MAX;  // how much of `fromServer` the socket takes before it is full
  bool ended = false;      // the client sends no more, once toServer is empty
  bool closed = false;     // the server has closed its end
  size_t writes = 0, reads = 0;
  // Descriptors that come with the next read: numbers from 1000, closed into `closedDescriptors`.
  int passed = 0;
  PeerCredentials credentials;
  static inline int closedDescriptors = 0;
};

class MemoryStream final : public Stream {
 public:
  MemoryStream(std::shared_ptr<MemoryPipe> pipe, int descriptor)
      : pipe_(std::move(pipe)), descriptor_(descriptor) {}
  ~MemoryStream() override { pipe_->closed = true; }
  [[nodiscard]] StreamResult read(std::span<std::byte> buffer, std::vector<Descriptor>& descriptors) override;
  [[nodiscard]] StreamResult write(std::string_view bytes) override;
  [[nodiscard]] PeerCredentials peer() override { return std::move(pipe_->credentials); }
  [[nodiscard]] int descriptor() const override { return descriptor_; }

 private:
  const std::shared_ptr<MemoryPipe> pipe_;
  const int descriptor_;
};

// Offers the streams that a test puts in.
class MemoryAcceptor final : public StreamAcceptor {
 public:
  static constexpr int kDescriptor = 1;
  [[nodiscard]] AcceptStatus accept(std::unique_ptr<Stream>& stream) override;
  [[nodiscard]] int descriptor() const override { return kDescriptor; }
  std::vector<std::unique_ptr<Stream>> waiting;
  AcceptStatus whenEmpty = AcceptStatus::wouldBlock;
};

class ManualReactor final : public Reactor {
 public:
  Watch watch(int descriptor, unsigned events, Handler handler) override;
  // Runs the handler when it waits for one of these events (or they are an end or a failure); whether it did.
  bool report(int descriptor, unsigned events);
  // What the watch of a descriptor waits for; 0: nothing, or nobody watches it.
  [[nodiscard]] unsigned waitsFor(int descriptor) const;
  bool refuses = false;  // to watch anything, as a system without memory does
  void refuseToRearm(bool refuse) { *refusesToRearm_ = refuse; }
  std::function<void(int descriptor)> whenWatched;  // called before watch() returns

 private:
  class Registration;
  std::unordered_map<int, std::weak_ptr<Registration>> watches_;
  std::shared_ptr<bool> refusesToRearm_ = std::make_shared<bool>(false);
};

}  // namespace kyt
