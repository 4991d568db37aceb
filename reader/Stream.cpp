#include "reader/Stream.h"

#include <nats/nats.h>

#include <utility>

namespace kyt::reader {

namespace {

constexpr int64_t kMostBytes = 64 << 20;  // of one batch
constexpr int kQuietCalls = 4;            // of next(), after which the consumer is asked for

struct Freer {
  void operator()(natsOptions* options) const { natsOptions_Destroy(options); }
  void operator()(natsConnection* connection) const { natsConnection_Destroy(connection); }
  void operator()(jsCtx* context) const { jsCtx_Destroy(context); }
  void operator()(natsSubscription* subscription) const { natsSubscription_Destroy(subscription); }
  void operator()(natsMsg* message) const { natsMsg_Destroy(message); }
};
template <typename T>
using Handle = std::unique_ptr<T, Freer>;

std::string failure(const char* what, natsStatus status) {
  const char* detail = nats_GetLastError(nullptr);
  return std::string(what) + ": " + natsStatus_GetText(status) +
         (detail != nullptr && *detail != '\0' ? std::string(", ") + detail : std::string());
}

std::string header(natsMsg* message, const char* name) {
  const char* value = nullptr;
  return natsMsgHeader_Get(message, name, &value) == NATS_OK && value != nullptr ? value : "";
}

// Whoever put it into the stream was no receiver: it is known by its place there, and goes by.
void tellByPlace(natsMsg* message, Post& post) {
  post.problem = "no Kyt-Id, or headers that cannot be read";
  post.received = "0";
  jsMsgMetaData* place = nullptr;
  if (natsMsg_GetMetaData(&place, message) != NATS_OK) return;
  post.id = "message " + std::to_string(place->Sequence.Stream) + " of " + place->Stream;
  post.received = std::to_string(place->Timestamp / 1'000'000);
  jsMsgMetaData_Destroy(place);
}

bool isID(const std::string& text) {
  return text.size() == 64 && text.find_first_not_of("0123456789abcdef") == std::string::npos;
}

bool isNumber(const std::string& text) {
  return !text.empty() && text.size() < 16 && text.find_first_not_of("0123456789") == std::string::npos;
}

Post postOf(natsMsg* message) {
  Post post;
  post.id = header(message, "Kyt-Id");
  post.received = header(message, "Kyt-Received");
  post.path = header(message, "Kyt-Path");
  post.sender = header(message, "Kyt-Sender");
  post.client = header(message, "Kyt-Client");
  post.service = header(message, "Kyt-Service");
  post.clientVersion = header(message, "Kyt-Client-Version");
  post.digest = header(message, "Kyt-Digest");
  post.encoding = header(message, "Kyt-Encoding");
  post.body.assign(natsMsg_GetData(message), static_cast<size_t>(natsMsg_GetDataLength(message)));
  if (!isID(post.id) || !isNumber(post.received)) tellByPlace(message, post);
  return post;
}

}  // namespace

struct Stream::Handles {
  // The subscription goes before the connection that it uses.
  Handle<natsConnection> connection;
  Handle<jsCtx> context;
  Handle<natsSubscription> subscription;
  std::vector<Handle<natsMsg>> taken;
};

Stream::Stream(StreamOptions options) : options_(std::move(options)), handles_(std::make_unique<Handles>()) {}

Stream::~Stream() = default;

std::optional<std::string> Stream::open() {
  *handles_ = Handles();
  quietCalls_ = 0;
  natsOptions* made = nullptr;
  natsStatus status = natsOptions_Create(&made);
  const Handle<natsOptions> options(made);
  std::vector<const char*> servers;
  for (const std::string& server : options_.servers) servers.push_back(server.c_str());
  if (status == NATS_OK)
    status = natsOptions_SetServers(made, servers.data(), static_cast<int>(servers.size()));
  if (status == NATS_OK) status = natsOptions_SetMaxReconnect(made, -1);
  if (status == NATS_OK) status = natsOptions_SetReconnectWait(made, 250);
  natsConnection* connection = nullptr;
  if (status == NATS_OK) status = natsConnection_Connect(&connection, made);
  handles_->connection.reset(connection);
  if (status != NATS_OK) return failure("no connection to the log", status);

  jsCtx* context = nullptr;
  status = natsConnection_JetStream(&context, connection, nullptr);
  handles_->context.reset(context);
  if (status != NATS_OK) return failure("no JetStream", status);

  jsSubOptions how;
  jsSubOptions_Init(&how);
  how.Stream = options_.stream.c_str();
  how.Config.Durable = options_.durable.c_str();
  how.Config.AckPolicy = js_AckExplicit;
  how.Config.AckWait = int64_t{options_.acknowledgeWithin} * 1'000'000'000;
  how.Config.MaxDeliver = -1;
  natsSubscription* subscription = nullptr;
  jsErrCode code{};
  status = js_PullSubscribe(&subscription, context, "kyt.events.>", options_.durable.c_str(), nullptr, &how,
                            &code);
  handles_->subscription.reset(subscription);
  if (status != NATS_OK) return failure("no consumer", status);
  return std::nullopt;
}

std::vector<Post> Stream::next(std::chrono::milliseconds time, std::optional<std::string>& problem) {
  problem.reset();
  handles_->taken.clear();
  jsFetchRequest request;
  jsFetchRequest_Init(&request);
  request.Batch = options_.batch;
  request.MaxBytes = kMostBytes;
  request.Expires = std::chrono::nanoseconds(time).count();
  natsMsgList list{};
  const natsStatus status = natsSubscription_FetchRequest(&list, handles_->subscription.get(), &request);
  std::vector<Post> posts;
  for (int i = 0; i < list.Count; ++i) {
    posts.push_back(postOf(list.Msgs[i]));
    handles_->taken.emplace_back(std::exchange(list.Msgs[i], nullptr));
  }
  natsMsgList_Destroy(&list);
  if (posts.empty() && status != NATS_OK && status != NATS_TIMEOUT)
    problem = failure("nothing can be read", status);
  quietCalls_ = posts.empty() && !problem ? quietCalls_ + 1 : 0;
  if (quietCalls_ >= kQuietCalls) problem = askForConsumer();
  return posts;
}

std::optional<std::string> Stream::askForConsumer() {
  quietCalls_ = 0;
  jsConsumerInfo* info = nullptr;
  const natsStatus status = js_GetConsumerInfo(&info, handles_->context.get(), options_.stream.c_str(),
                                               options_.durable.c_str(), nullptr, nullptr);
  jsConsumerInfo_Destroy(info);
  return status == NATS_OK ? std::nullopt : std::optional(failure("no consumer", status));
}

std::optional<std::string> Stream::acknowledge() {
  natsStatus status = NATS_OK;
  for (const Handle<natsMsg>& message : handles_->taken) {
    const natsStatus one = natsMsg_Ack(message.get(), nullptr);
    if (one != NATS_OK) status = one;
  }
  handles_->taken.clear();
  // An acknowledgement that is lost costs a repeat, which the table knows.
  if (status == NATS_OK) status = natsConnection_FlushTimeout(handles_->connection.get(), 5000);
  return status == NATS_OK ? std::nullopt : std::optional(failure("not all could be acknowledged", status));
}

}  // namespace kyt::reader
