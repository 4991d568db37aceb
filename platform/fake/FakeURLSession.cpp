#include "platform/fake/FakeURLSession.h"

#include <atomic>
#include <condition_variable>
#include <mutex>

#include "platform/base/Books.h"
#include "platform/base/OutstandingBytes.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

class FakeURLSessionFactory::State : public std::enable_shared_from_this<FakeURLSessionFactory::State> {
 public:
  struct Entry {
    URLRequest request;
    URLSessionConfiguration configuration;
    size_t session = 0;
    URLCompletion completion;
    std::shared_ptr<SerialQueue> queue;
    std::shared_ptr<OutstandingBytes> outstanding;
    size_t charge = 0;
    bool open = true, waits = false;
  };

  explicit State(Executor* executor) : executor_(executor) {}

  size_t addSession(std::shared_ptr<SerialQueue>& queue) {
    std::lock_guard lock(mutex_);
    if (executor_ != nullptr) queue = SerialQueue::create("fake URL session", *executor_);
    return sessions_++;
  }

  void sessionInvalidated() {
    std::lock_guard lock(mutex_);
    ++invalidated_;
  }

  size_t start(Entry entry, bool refused) {
    Responder responder;
    size_t index = 0;
    const size_t charge = countedBytes(entry.request);
    const bool tooMuch = !refused && !entry.outstanding->user(entry.request.account).take(charge);
    if (!refused && !tooMuch) entry.charge = charge;
    {
      std::lock_guard lock(mutex_);
      refused = refused || cancelled_ || (awaitedCancelled_ && entry.request.isAwaited) || tooMuch;
      if (tooMuch) ++figures_.refused;
      index = entries_.size();
      if (!refused) responder = responder_;
      entries_.push_back(std::make_unique<Entry>(std::move(entry)));
      ++figures_.started;
      ++open_;
      grew_.notify_all();
    }
    if (tooMuch) {
      fail(index, kURLErrorOutstandingTooMuch, "Too much was outstanding");
    } else if (refused) {
      cancel(index);
    } else if (responder) {
      if (std::optional<Reply> reply = responder(request(index))) answer(index, std::move(*reply));
    }
    return index;
  }

  bool answer(size_t index, Reply reply) {
    URLCompletion completion;
    std::shared_ptr<SerialQueue> queue;
    {
      std::lock_guard lock(mutex_);
      Entry& entry = *entries_.at(index);
      if (!entry.open) return false;
      entry.open = false;
      setWaiting(entry, false);
      entry.outstanding->user(entry.request.account).giveBack(entry.charge);
      --open_;
      ++(reply.error ? figures_.failed : figures_.completed);
      completion = std::move(entry.completion);
      queue = entry.queue;
    }
    if (!completion) return true;
    auto deliver = [completion = std::move(completion), reply = std::move(reply)]() mutable {
      if (reply.error) {
        completion(std::nullopt, std::nullopt, std::move(reply.error));
      } else {
        completion(Data(std::string_view(reply.body)), URLResponse{reply.status, std::move(reply.headers)},
                   std::nullopt);
      }
    };
    if (queue) {
      queue->async(std::move(deliver));
    } else {
      deliver();
    }
    return true;
  }

  static void setWaiting(Entry& entry, bool waits) {
    if (std::exchange(entry.waits, waits) == waits || !entry.request.events) return;
    if (waits)
      entry.request.events->beginWaiting();
    else
      entry.request.events->endWaiting();
  }

  void cancel(size_t index) { fail(index, kURLErrorCancelled, "cancelled"); }

  void fail(size_t index, int32_t code, const char* description) {
    Reply reply;
    reply.error = Error{kKYTURLErrorDomain, code, description};
    answer(index, std::move(reply));
  }

  void cancelAwaited() {
    std::vector<size_t> awaited;
    {
      std::lock_guard lock(mutex_);
      awaitedCancelled_ = true;
      for (size_t index = 0; index < entries_.size(); ++index)
        if (entries_[index]->request.isAwaited) awaited.push_back(index);
    }
    for (const size_t index : awaited) cancel(index);
  }

  void cancelAll() {
    size_t count = 0;
    {
      std::lock_guard lock(mutex_);
      cancelled_ = true;
      count = entries_.size();
    }
    for (size_t index = 0; index < count; ++index) cancel(index);
  }

  // Completions of requests that nobody answered are destroyed, whatever they hold included.
  void drop() {
    std::vector<URLCompletion> dropped;  // destroyed after the lock is released: they may own anything
    std::lock_guard lock(mutex_);
    cancelled_ = true;
    executor_ = nullptr;
    for (auto& entry : entries_) dropped.push_back(std::move(entry->completion));
  }

  URLRequest request(size_t index) const {
    std::lock_guard lock(mutex_);
    return entries_.at(index)->request;
  }

  Executor* executor_;
  mutable std::mutex mutex_;
  mutable std::condition_variable grew_;
  std::vector<std::unique_ptr<Entry>> entries_;
  Responder responder_;
  URLFigures figures_;
  std::shared_ptr<Function<void()>> watcher_;
  size_t open_ = 0, sessions_ = 0, invalidated_ = 0;
  bool cancelled_ = false, awaitedCancelled_ = false;
};

namespace {

class FakeURLTask final : public URLTask {
 public:
  FakeURLTask(std::shared_ptr<FakeURLSessionFactory::State> state, size_t index)
      : state_(std::move(state)), index_(index) {}
  void cancel() override { state_->cancel(index_); }

 private:
  std::shared_ptr<FakeURLSessionFactory::State> state_;
  size_t index_;
};

class FakeURLSession final : public URLSession {
 public:
  FakeURLSession(std::shared_ptr<FakeURLSessionFactory::State> state, URLSessionConfiguration configuration)
      : state_(std::move(state)),
        configuration_(std::move(configuration)),
        number_(state_->addSession(queue_)) {}
  ~FakeURLSession() override { FakeURLSession::finishTasksAndInvalidate(); }

  std::shared_ptr<URLTask> start(URLRequest request, URLCompletion completion) override {
    FakeURLSessionFactory::State::Entry entry;
    entry.request = std::move(request);
    entry.configuration = configuration_;
    entry.session = number_;
    entry.completion = std::move(completion);
    entry.queue = queue_;
    entry.outstanding = outstanding_;
    const size_t index = state_->start(std::move(entry), invalidated_);
    return std::make_shared<FakeURLTask>(state_, index);
  }

  void finishTasksAndInvalidate() override {
    if (!invalidated_.exchange(true)) state_->sessionInvalidated();
  }

 private:
  std::shared_ptr<FakeURLSessionFactory::State> state_;
  URLSessionConfiguration configuration_;
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<OutstandingBytes> outstanding_ = std::make_shared<OutstandingBytes>();
  size_t number_;
  std::atomic<bool> invalidated_{false};
};

}  // namespace

FakeURLSessionFactory::FakeURLSessionFactory(Executor* executor)
    : state_(std::make_shared<State>(executor)) {}

FakeURLSessionFactory::~FakeURLSessionFactory() {
  state_->drop();
}

std::unique_ptr<URLSession> FakeURLSessionFactory::create(URLSessionConfiguration configuration) {
  return std::make_unique<FakeURLSession>(state_, std::move(configuration));
}

void FakeURLSessionFactory::cancelAwaited() {
  state_->cancelAwaited();
}

void FakeURLSessionFactory::cancelAll() {
  state_->cancelAll();
}

URLFigures FakeURLSessionFactory::figures() const {
  std::lock_guard lock(state_->mutex_);
  return state_->figures_;
}

size_t FakeURLSessionFactory::outstanding() const {
  std::lock_guard lock(state_->mutex_);
  return state_->open_;
}

void FakeURLSessionFactory::setResponder(Responder responder) {
  std::lock_guard lock(state_->mutex_);
  state_->responder_ = std::move(responder);
}

size_t FakeURLSessionFactory::requestCount() const {
  std::lock_guard lock(state_->mutex_);
  return state_->entries_.size();
}

URLRequest FakeURLSessionFactory::request(size_t index) const {
  return state_->request(index);
}

URLRequest FakeURLSessionFactory::lastRequest() const {
  return state_->request(requestCount() - 1);
}

URLSessionConfiguration FakeURLSessionFactory::configurationOf(size_t index) const {
  std::lock_guard lock(state_->mutex_);
  return state_->entries_.at(index)->configuration;
}

size_t FakeURLSessionFactory::sessionOf(size_t index) const {
  std::lock_guard lock(state_->mutex_);
  return state_->entries_.at(index)->session;
}

bool FakeURLSessionFactory::isOpen(size_t index) const {
  std::lock_guard lock(state_->mutex_);
  return state_->entries_.at(index)->open;
}

std::optional<std::string> FakeURLSessionFactory::requestHeader(size_t index, std::string_view name) const {
  const URLRequest found = request(index);
  for (const auto& [key, value] : found.headers)
    if (key == name) return value;
  return std::nullopt;
}

bool FakeURLSessionFactory::waitForRequests(size_t count, Duration timeout) const {
  std::unique_lock lock(state_->mutex_);
  return state_->grew_.wait_until(lock, std::chrono::steady_clock::now() + timeout,
                                  [&] { return state_->entries_.size() >= count; });
}

void FakeURLSessionFactory::watchConnectivity(std::shared_ptr<Function<void()>> changed) {
  std::lock_guard lock(state_->mutex_);
  state_->watcher_ = std::move(changed);
}

bool FakeURLSessionFactory::isWatched() const {
  std::lock_guard lock(state_->mutex_);
  return state_->watcher_ != nullptr;
}

void FakeURLSessionFactory::changeConnectivity() {
  std::shared_ptr<Function<void()>> watcher;
  {
    std::lock_guard lock(state_->mutex_);
    watcher = state_->watcher_;
  }
  if (watcher) (*watcher)();
}

size_t FakeURLSessionFactory::sessionsCreated() const {
  std::lock_guard lock(state_->mutex_);
  return state_->sessions_;
}

size_t FakeURLSessionFactory::sessionsInvalidated() const {
  std::lock_guard lock(state_->mutex_);
  return state_->invalidated_;
}

bool FakeURLSessionFactory::complete(size_t index, int status, Headers headers, std::string_view body) {
  return state_->answer(index, Reply{status, std::move(headers), std::string(body), std::nullopt});
}

bool FakeURLSessionFactory::fail(size_t index, Error error) {
  Reply reply;
  reply.error = std::move(error);
  return state_->answer(index, std::move(reply));
}

bool FakeURLSessionFactory::answer(size_t index, Reply reply) {
  return state_->answer(index, std::move(reply));
}

void FakeURLSessionFactory::setWaiting(size_t index, bool waits) {
  std::lock_guard lock(state_->mutex_);
  State::Entry& entry = *state_->entries_.at(index);
  if (entry.open) State::setWaiting(entry, waits);
}

}  // namespace kyt
