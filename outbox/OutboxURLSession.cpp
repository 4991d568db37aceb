#include "outbox/OutboxURLSession.h"

#include <utility>

#include "platform/base/Mutex.h"
#include "platform/base/UserBudget.h"
#include "platform/queues/SerialQueue.h"

namespace kyt {

struct OutboxURLSessionFactory::Shared {
  Shared(URLSessionFactory& below, std::shared_ptr<Outbox> box, Executor& completions)
      : network(below), outbox(std::move(box)), executor(completions) {}
  URLSessionFactory& network;
  const std::shared_ptr<Outbox> outbox;
  Executor& executor;
  std::atomic<size_t> outstanding{0};
};

namespace {

// libcurl's codes for a request that did not leave.
constexpr int32_t kUnsupportedProtocol = 1, kMalformedAddress = 3, kCouldNotResolve = 6, kCouldNotConnect = 7,
                  kInterfaceFailed = 45;

bool didNotLeave(const std::optional<Error>& error) {
  return error && error->domain == kKYTURLErrorDomain &&
         (error->code == kCouldNotResolve || error->code == kCouldNotConnect ||
          error->code == kInterfaceFailed);
}

// No other time makes a request of it.
bool isNoAddress(const std::optional<Error>& error) {
  return error && error->domain == kKYTURLErrorDomain &&
         (error->code == kUnsupportedProtocol || error->code == kMalformedAddress);
}

// The owner of the queue for posts of no user's: not the outbox's own, which may wait for its disk.
constexpr uint64_t kNobody = ~uint64_t{0};

// Counts while its completion has neither run nor been destroyed.
class Outstanding {
 public:
  explicit Outstanding(std::shared_ptr<OutboxURLSessionFactory::Shared> shared) : shared_(std::move(shared)) {
    shared_->outstanding.fetch_add(1);
  }
  Outstanding(Outstanding&&) noexcept = default;
  Outstanding& operator=(Outstanding&&) = delete;
  ~Outstanding() {
    if (shared_) shared_->outstanding.fetch_sub(1);
  }

 private:
  std::shared_ptr<OutboxURLSessionFactory::Shared> shared_;
};

// Of one session. Its requests keep it, so that the session below ends after the last of them is kept or answered.
class OutboxSessionState : public std::enable_shared_from_this<OutboxSessionState> {
 public:
  // A post that may be kept.
  struct Post {
    URLRequest request;
    URLCompletion completion;
    Outstanding outstanding;
    bool isSecondTry = false;  // the first one never left, and could not be kept
  };

  OutboxSessionState(std::shared_ptr<OutboxURLSessionFactory::Shared> shared,
                     URLSessionConfiguration configuration)
      : shared_(std::move(shared)),
        configuration_(configuration),
        session_(shared_->network.create(std::move(configuration))) {}

  std::shared_ptr<URLTask> start(URLRequest request, URLCompletion completion) {
    if (isInvalidated_.load()) session_->finishTasksAndInvalidate();
    Outstanding outstanding(shared_);
    if (request.method == "POST" && request.events)
      return startPost(
          std::make_shared<Post>(Post{std::move(request), std::move(completion), std::move(outstanding)}));
    return session_->start(std::move(request),
                           [outstanding = std::move(outstanding), completion = std::move(completion)](
                               auto... reply) mutable { completion(std::move(reply)...); });
  }
  void invalidate() { isInvalidated_ = true; }

 private:
  std::shared_ptr<URLTask> startPost(const std::shared_ptr<Post>& post) {
    URLRequest first = post->request;
    first.neverWaits = !post->isSecondTry && shared_->outbox->isTaking();
    return session_->start(std::move(first), [self = shared_from_this(), post](auto... reply) {
      self->ended(*post, {std::move(reply)...});
    });
  }

  void ended(Post& post, URLReply reply) {
    const URLResponse* response = reply.response ? &*reply.response : nullptr;
    const PostVerdict verdict = verdictOf(response, reply.error ? &*reply.error : nullptr);
    if (verdict == PostVerdict::taken) shared_->outbox->serverAnswers(post.request.url);
    if (verdict != PostVerdict::sendAgain || isNoAddress(reply.error))
      return post.completion(std::move(reply.data), std::move(reply.response), std::move(reply.error));
    FailedPost failed;
    failed.post.user = post.request.account ? post.request.account->user() : kNoUser;
    failed.post.isByConsent = post.request.isByConsent;
    failed.post.allowsCellularAccess = post.request.allowsCellularAccess;
    failed.post.url = post.request.url;
    failed.post.identity = post.request.identity;
    failed.post.sourceApplication = configuration_.sourceApplication;
    failed.post.headers = post.request.headers;
    failed.post.body = post.request.body;
    failed.booked = post.request.events;
    failed.retryAfter = shared_->outbox->pauseBy(response);
    failed.isUnanswered = response == nullptr;
    failed.status = response != nullptr ? response->status : 0;
    failed.mayHaveLeft = mayHaveLeft(reply.response, reply.error);
    shared_->outbox->keep(std::move(failed), [self = shared_from_this(), post = std::move(post),
                                              reply = std::move(reply)](bool isKept) mutable {
      self->settled(std::move(post), std::move(reply), isKept);
    });
  }

  void settled(Post post, URLReply reply, bool isKept) {
    if (isKept) reply = URLReply();
    const bool mayLeave = !post.request.isByConsent || shared_->outbox->isConsentGiven();
    if (!isKept && didNotLeave(reply.error) && !post.isSecondTry && mayLeave) {
      // As without an outbox: it may wait for connectivity.
      post.isSecondTry = true;
      startPost(std::make_shared<Post>(std::move(post)));
      return;
    }
    const uint64_t owner = post.request.account ? uint64_t{post.request.account->user()} + 1 : kNobody;
    queue(owner)->asyncBeside([post = std::move(post), reply = std::move(reply)]() mutable {
      post.completion(std::move(reply.data), std::move(reply.response), std::move(reply.error));
    });
  }

  std::shared_ptr<SerialQueue> queue(uint64_t owner) {
    MutexLock lock(mutex_);
    for (const auto& known : queues_)
      if (known->owner() == owner) return known;
    return queues_.emplace_back(SerialQueue::create("outbox completions", shared_->executor, owner));
  }

  const std::shared_ptr<OutboxURLSessionFactory::Shared> shared_;
  const URLSessionConfiguration configuration_;
  const std::unique_ptr<URLSession> session_;
  std::atomic<bool> isInvalidated_{false};
  Mutex mutex_;
  std::vector<std::shared_ptr<SerialQueue>> queues_ GUARDED_BY(mutex_);  // one for each user
};

class OutboxURLSession final : public URLSession {
 public:
  explicit OutboxURLSession(std::shared_ptr<OutboxSessionState> state) : state_(std::move(state)) {}
  ~OutboxURLSession() override { OutboxURLSession::finishTasksAndInvalidate(); }
  std::shared_ptr<URLTask> start(URLRequest request, URLCompletion completion) override {
    return state_->start(std::move(request), std::move(completion));
  }
  void finishTasksAndInvalidate() override { state_->invalidate(); }

 private:
  const std::shared_ptr<OutboxSessionState> state_;
};

}  // namespace

OutboxURLSessionFactory::OutboxURLSessionFactory(URLSessionFactory& network, std::shared_ptr<Outbox> outbox,
                                                 Executor& completions)
    : shared_(std::make_shared<Shared>(network, std::move(outbox), completions)) {}

std::unique_ptr<URLSession> OutboxURLSessionFactory::create(URLSessionConfiguration configuration) {
  return std::make_unique<OutboxURLSession>(
      std::make_shared<OutboxSessionState>(shared_, std::move(configuration)));
}

void OutboxURLSessionFactory::cancelAwaited() {
  shared_->network.cancelAwaited();
}
void OutboxURLSessionFactory::cancelAll() {
  shared_->outbox->stopSending();
  shared_->network.cancelAll();
}
URLFigures OutboxURLSessionFactory::figures() const {
  return shared_->network.figures();
}
size_t OutboxURLSessionFactory::outstanding() const {
  return shared_->outstanding.load();
}
void OutboxURLSessionFactory::watchConnectivity(std::shared_ptr<Function<void()>> changed) {
  shared_->network.watchConnectivity(std::move(changed));
}

}  // namespace kyt
