#include "platform/base/Watchers.h"

#include <algorithm>
#include <thread>
#include <utility>

#include "platform/base/WatchRing.h"

namespace kyt {

namespace {

// One that reads nothing leaves room for the others' bodies, and for those on their way.
constexpr size_t kMostBodiesOfWatcher = Limits::maxWatchedBodies / (Limits::maxWatchers + 1);

}  // namespace

struct Watchers::Ring {
  explicit Ring(WatchFilter f) : filter(std::move(f)) {}
  const WatchFilter filter;
  WatchRing<PassedEvent> events{Limits::maxWatchedEvents};
  std::atomic<uint64_t> lost{0};
  std::atomic<size_t> bodyBytes{0};  // that wait in it

  // Whether it has room for so many bytes of a body more, which it has now.
  [[nodiscard]] bool takeRoom(size_t bytes) {
    if (bodyBytes.fetch_add(bytes, std::memory_order_relaxed) + bytes <= kMostBodiesOfWatcher) return true;
    bodyBytes.fetch_sub(bytes, std::memory_order_relaxed);
    return false;
  }
};

bool WatchFilter::admitsProgram(const ReportingProgram& program) const {
  return (!user || *user == program.user) && (!client || *client == cutName(program.clientName));
}

bool WatchFilter::admits(const ReportingProgram& program, EventKind kind) const {
  return admitsProgram(program) && (!category || *category == kind.category);
}

WatchedBody::WatchedBody(std::shared_ptr<Watchers> watchers, std::string_view text)
    : watchers_(std::move(watchers)), text_(text) {}

WatchedBody::~WatchedBody() {
  watchers_->bodyBytes_.fetch_sub(text_.size(), std::memory_order_relaxed);
}

void WatchedPost::leaves(std::string_view server, std::string_view body) {
  number_ = watchers_->posts_.fetch_add(1, std::memory_order_relaxed) + 1;
  server_ = server;
  bodyBytes_ = body.size();
  if (!watchers_->wantsBodies()) return;
  const std::string_view kept = cutUTF8(body, Limits::maxWatchedBodyBytes);
  if (watchers_->takeRoom(kept.size())) body_ = std::make_shared<const WatchedBody>(watchers_, kept);
}

Watchers::Watchers() = default;
Watchers::~Watchers() = default;

std::unique_ptr<Watcher> Watchers::watch(WatchFilter filter, bool isOwner) {
  const size_t most = isOwner ? Limits::maxWatchers : Limits::maxWatchersOfGroup;
  const bool bodies = filter.bodies;
  auto ring = std::make_unique<Ring>(std::move(filter));
  MutexLock lock(mutex_);
  for (size_t i = most; i-- > 0;) {
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
void Watchers::forEachRing(const ReportingProgram& program, Use use) {
  for (size_t number = 0; number < places_.size(); ++number) {
    Place& place = places_[number];
    if (place.ring.load(std::memory_order_relaxed) == nullptr) continue;
    place.tellers.fetch_add(1);
    Ring* ring = place.ring.load();
    if (ring != nullptr && ring->filter.admitsProgram(program)) use(*ring, number);
    place.tellers.fetch_sub(1);
  }
}

template <typename Use>
void Watchers::forEachRing(const ReportingProgram& program, EventKind kind, Use use) {
  forEachRing(program, [&](Ring& ring, size_t number) {
    if (ring.filter.admits(program, kind)) use(ring, number);
  });
}

bool Watchers::want(const ReportingProgram& program, EventKind kind) {
  bool hasRoom = false;
  forEachRing(program, kind,
              [&hasRoom](const Ring& ring, size_t) { hasRoom = hasRoom || ring.events.hasRoom(); });
  if (!hasRoom)
    forEachRing(program, kind, [](Ring& ring, size_t) { ring.lost.fetch_add(1, std::memory_order_relaxed); });
  return hasRoom;
}

// A watcher that reads nothing has a full ring for as long as it lasts: a post of a thousand events looks at it once.
bool Watchers::loseAll(const ReportingProgram& program, std::span<const EventKind> kinds, size_t count) {
  bool hasRoom = false;
  forEachRing(program, [&hasRoom](const Ring& ring, size_t) { hasRoom = hasRoom || ring.events.hasRoom(); });
  if (hasRoom) return false;
  forEachRing(program, [&](Ring& ring, size_t) {
    const auto isOf = [category = ring.filter.category](EventKind kind) {
      return kind.category == *category;
    };
    const auto lost =
        ring.filter.category ? static_cast<size_t>(std::count_if(kinds.begin(), kinds.end(), isOf)) : count;
    ring.lost.fetch_add(lost, std::memory_order_relaxed);
  });
  return true;
}

void Watchers::tell(PassedEvent event, ToldBody* body) {
  event.program.clientName = cutName(event.program.clientName);
  event.program.service = cutName(event.program.service);
  const auto plain = std::make_shared<const PassedEvent>(std::move(event));
  std::shared_ptr<const PassedEvent> withBody, withoutRoom;  // for those to whom it is the first of its post
  const auto firstOf = [&plain](const std::shared_ptr<const WatchedBody>& text) {
    PassedEvent first = *plain;
    first.isFirstOfPost = true;
    first.body = text;
    return std::make_shared<const PassedEvent>(std::move(first));
  };
  forEachRing(plain->program, plain->kind, [&](Ring& ring, size_t place) {
    const bool isFirst = body != nullptr && ring.filter.bodies && (body->had >> place & 1) == 0;
    const size_t bytes = isFirst && body->body != nullptr ? body->body->text().size() : 0;
    const bool getsBody = bytes != 0 && ring.takeRoom(bytes);
    std::shared_ptr<const PassedEvent>& first = getsBody ? withBody : withoutRoom;
    if (isFirst && first == nullptr) first = firstOf(getsBody ? body->body : nullptr);
    if (ring.events.put(isFirst ? first : plain)) {
      if (isFirst) body->had |= uint32_t{1} << place;
      return;
    }
    ring.lost.fetch_add(1, std::memory_order_relaxed);
    if (getsBody) ring.bodyBytes.fetch_sub(bytes, std::memory_order_relaxed);
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
  Watchers::Ring& ring = *watchers_->places_[place_].ring.load();
  std::shared_ptr<const PassedEvent> event = ring.events.take();
  if (event != nullptr && event->body != nullptr)
    ring.bodyBytes.fetch_sub(event->body->text().size(), std::memory_order_relaxed);
  return event;
}

uint64_t Watcher::takeLost() {
  return watchers_->places_[place_].ring.load()->lost.exchange(0, std::memory_order_relaxed);
}

}  // namespace kyt
