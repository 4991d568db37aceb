#include "platform/base/Watchers.h"

#include <thread>
#include <utility>

#include "platform/base/WatchRing.h"

namespace kyt {

struct Watchers::Ring {
  explicit Ring(WatchFilter f) : filter(std::move(f)) {}
  const WatchFilter filter;
  WatchRing<PassedEvent> events{Limits::maxWatchedEvents};
  std::atomic<uint64_t> lost{0};
};

bool WatchFilter::admits(const ReportingProgram& program, EventKind kind) const {
  return (!user || *user == program.user) && (!client || *client == cutName(program.clientName)) &&
         (!category || *category == kind.category);
}

WatchedPost::~WatchedPost() {
  watchers_->bodyBytes_.fetch_sub(body_.size(), std::memory_order_relaxed);
}

void WatchedPost::leaves(std::string_view server, std::string_view body) {
  number_ = watchers_->posts_.fetch_add(1, std::memory_order_relaxed) + 1;
  server_ = server;
  bodyBytes_ = body.size();
  if (!watchers_->wantsBodies()) return;
  const std::string_view kept = cutUTF8(body, Limits::maxWatchedBodyBytes);
  if (watchers_->takeRoom(kept.size())) body_ = kept;
}

Watchers::Watchers() = default;
Watchers::~Watchers() = default;

std::unique_ptr<Watcher> Watchers::watch(WatchFilter filter) {
  const bool bodies = filter.bodies;
  auto ring = std::make_unique<Ring>(std::move(filter));
  MutexLock lock(mutex_);
  for (size_t i = 0; i < places_.size(); ++i) {
    if (places_[i].ring.load() != nullptr) continue;
    places_[i].ring.store(ring.release());
    watching_.fetch_add(1, std::memory_order_relaxed);
    if (bodies) wantingBodies_.fetch_add(1, std::memory_order_relaxed);
    return std::make_unique<Watcher>(shared_from_this(), i, bodies);
  }
  return nullptr;
}

// Whoever tells says so before it looks at the ring, and whoever takes the ring away looks for tellers afterwards: so one of
// the two sees the other. Who finds no ring at first stays out, so that there is an end to the wait.
template <typename Use>
void Watchers::forEachRing(const ReportingProgram& program, EventKind kind, Use use) {
  for (Place& place : places_) {
    if (place.ring.load(std::memory_order_relaxed) == nullptr) continue;
    place.tellers.fetch_add(1);
    Ring* ring = place.ring.load();
    if (ring != nullptr && ring->filter.admits(program, kind)) use(*ring);
    place.tellers.fetch_sub(1);
  }
}

bool Watchers::want(const ReportingProgram& program, EventKind kind) {
  bool hasRoom = false;
  forEachRing(program, kind, [&hasRoom](const Ring& ring) { hasRoom = hasRoom || ring.events.hasRoom(); });
  if (!hasRoom)
    forEachRing(program, kind, [](Ring& ring) { ring.lost.fetch_add(1, std::memory_order_relaxed); });
  return hasRoom;
}

void Watchers::tell(PassedEvent event) {
  event.program.clientName = cutName(event.program.clientName);
  event.program.service = cutName(event.program.service);
  const auto shared = std::make_shared<const PassedEvent>(std::move(event));
  forEachRing(shared->program, shared->kind, [&shared](Ring& ring) {
    if (!ring.events.put(shared)) ring.lost.fetch_add(1, std::memory_order_relaxed);
  });
}

bool Watchers::takeRoom(size_t bytes) {
  if (bodyBytes_.fetch_add(bytes, std::memory_order_relaxed) + bytes <= Limits::maxWatchedBodies) return true;
  bodyBytes_.fetch_sub(bytes, std::memory_order_relaxed);
  return false;
}

void Watchers::end(size_t place, bool bodies) {
  MutexLock lock(mutex_);
  watching_.fetch_sub(1, std::memory_order_relaxed);
  if (bodies) wantingBodies_.fetch_sub(1, std::memory_order_relaxed);
  const std::unique_ptr<Ring> ring(places_[place].ring.exchange(nullptr));
  while (places_[place].tellers.load() != 0) std::this_thread::yield();
}

Watcher::~Watcher() {
  watchers_->end(place_, bodies_);
}

// The place's ring is this watcher's until its end.
std::shared_ptr<const PassedEvent> Watcher::next() {
  return watchers_->places_[place_].ring.load()->events.take();
}

uint64_t Watcher::takeLost() {
  return watchers_->places_[place_].ring.load()->lost.exchange(0, std::memory_order_relaxed);
}

}  // namespace kyt
