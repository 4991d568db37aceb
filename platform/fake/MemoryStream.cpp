#include "platform/fake/MemoryStream.h"

#include <algorithm>
#include <cstring>

namespace kyt {

StreamResult MemoryStream::read(std::span<std::byte> buffer, std::vector<Descriptor>& descriptors) {
  ++pipe_->reads;
  if (pipe_->toServer.empty()) return {pipe_->ended ? StreamStatus::ended : StreamStatus::wouldBlock, 0};
  for (; pipe_->passed > 0; --pipe_->passed) {
    descriptors.emplace_back(1000 + pipe_->passed, [](int) { ++MemoryPipe::closedDescriptors; });
  }
  const size_t count = std::min(buffer.size(), pipe_->toServer.size());
  std::memcpy(buffer.data(), pipe_->toServer.data(), count);
  pipe_->toServer.erase(0, count);
  return {StreamStatus::ok, count};
}

StreamResult MemoryStream::write(std::string_view bytes) {
  ++pipe_->writes;
  const size_t room = pipe_->room > pipe_->fromServer.size() ? pipe_->room - pipe_->fromServer.size() : 0;
  if (room == 0) return {StreamStatus::wouldBlock, 0};
  const size_t count = std::min(room, bytes.size());
  pipe_->fromServer.append(bytes.substr(0, count));
  return {StreamStatus::ok, count};
}

AcceptStatus MemoryAcceptor::accept(std::unique_ptr<Stream>& stream) {
  if (waiting.empty()) return whenEmpty;
  stream = std::move(waiting.front());
  waiting.erase(waiting.begin());
  return AcceptStatus::accepted;
}

class ManualReactor::Registration final : public Watch::State {
 public:
  Registration(unsigned events, Handler handler, std::shared_ptr<const bool> refuses)
      : events_(events), handler_(std::move(handler)), refuses_(std::move(refuses)) {}
  bool modify(unsigned events) override {
    events_ = events;
    silent_ = false;
    return !cancelled_;
  }
  bool rearm() override {
    if (*refuses_) return false;
    silent_ = false;
    return !cancelled_;
  }
  void cancel() override { cancelled_ = true; }
  [[nodiscard]] unsigned waitsFor() const {
    return cancelled_ || silent_ ? 0 : events_ & (ready::readable | ready::writable);
  }
  bool report(unsigned events) {
    const unsigned reported = (events & events_) | (events & (ready::ended | ready::failed));
    if (cancelled_ || silent_ || reported == 0) return false;
    silent_ = (events_ & ready::oneShot) != 0;
    handler_(reported);
    return true;
  }

 private:
  unsigned events_;
  Handler handler_;
  const std::shared_ptr<const bool> refuses_;
  bool silent_ = false, cancelled_ = false;
};

Watch ManualReactor::watch(int descriptor, unsigned events, Handler handler) {
  if (refuses) return {};
  auto registration = std::make_shared<Registration>(events, std::move(handler), refusesToRearm_);
  watches_[descriptor] = registration;
  if (whenWatched) whenWatched(descriptor);
  return Watch(std::move(registration));
}

bool ManualReactor::report(int descriptor, unsigned events) {
  const auto found = watches_.find(descriptor);
  if (found == watches_.end()) return false;
  const std::shared_ptr<Registration> registration = found->second.lock();
  return registration != nullptr && registration->report(events);
}

unsigned ManualReactor::waitsFor(int descriptor) const {
  const auto found = watches_.find(descriptor);
  if (found == watches_.end()) return 0;
  const std::shared_ptr<Registration> registration = found->second.lock();
  return registration == nullptr ? 0 : registration->waitsFor();
}

}  // namespace kyt
