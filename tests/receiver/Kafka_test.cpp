// The receiver with the mock cluster of Kafka's client library, which speaks the protocol over TCP.
#include <gtest/gtest.h>
#include <librdkafka/rdkafka.h>
#include <librdkafka/rdkafka_mock.h>

#include <map>
#include <optional>
#include <string>

#include "tests/receiver/ReceiverProcess.h"
#include "tests/support/Eventually.h"

namespace kyt::receiver {
namespace {

constexpr int kBrokers = 3, kPartitions = 2;

// The library starts its threads by C's own calls, of which this sanitizer knows nothing: it ends the program.
#if defined(__has_feature)
#if __has_feature(thread_sanitizer)
constexpr bool kCannotRun = true;
#else
constexpr bool kCannotRun = false;
#endif
#else
constexpr bool kCannotRun = false;
#endif

class ReceiverOnKafka : public ::testing::Test {
 protected:
  void SetUp() override {
    if (kCannotRun) GTEST_SKIP() << "Kafka's library does not run under the thread sanitizer";
    host_ = client(RD_KAFKA_PRODUCER, {{"test.mock.num.brokers", std::to_string(kBrokers)}});
    ASSERT_NE(host_, nullptr);
    cluster_ = rd_kafka_handle_mock_cluster(host_);
    ASSERT_EQ(rd_kafka_mock_topic_create(cluster_, "kyt-events", kPartitions, kBrokers),
              RD_KAFKA_RESP_ERR_NO_ERROR);
    ReceiverProcess::Options options;
    options.kind = "kafka";
    options.servers = "[\"" + std::string(rd_kafka_mock_cluster_bootstraps(cluster_)) + "\"]";
    for (size_t at = 0; (at = options.servers.find(',', at)) != std::string::npos; at += 4)
      options.servers.replace(at, 1, "\", \"");
    options.log = "partitions = 2\n";
    receiver_.emplace(options);
    ASSERT_TRUE(receiver_->isReady()) << receiver_->output();
    ASSERT_TRUE(receiver_->becomesReady()) << receiver_->output();
  }
  void TearDown() override {
    receiver_.reset();
    if (host_ != nullptr) rd_kafka_destroy(host_);
  }
  using Values = std::map<std::string, std::string>;
  [[nodiscard]] static rd_kafka_t* client(rd_kafka_type_t type, const Values& values) {
    rd_kafka_conf_t* configuration = rd_kafka_conf_new();
    for (const auto& [name, value] : values)
      EXPECT_EQ(rd_kafka_conf_set(configuration, name.c_str(), value.c_str(), nullptr, 0), RD_KAFKA_CONF_OK);
    return rd_kafka_new(type, configuration, nullptr, 0);
  }
  // The keys of so many messages at least, and how often each came. By a client that was not there during an outage.
  std::map<std::string, int> read(size_t count) {
    rd_kafka_t* consumer =
        client(RD_KAFKA_CONSUMER,
               {{"bootstrap.servers", rd_kafka_mock_cluster_bootstraps(cluster_)}, {"group.id", "test"}});
    rd_kafka_topic_partition_list_t* all = rd_kafka_topic_partition_list_new(kPartitions);
    for (int i = 0; i < kPartitions; ++i) rd_kafka_topic_partition_list_add(all, "kyt-events", i)->offset = 0;
    EXPECT_EQ(rd_kafka_assign(consumer, all), RD_KAFKA_RESP_ERR_NO_ERROR);
    rd_kafka_topic_partition_list_destroy(all);
    std::map<std::string, int> keys;
    EXPECT_TRUE(eventually([&] {
      rd_kafka_message_t* message = rd_kafka_consumer_poll(consumer, 100);
      if (message != nullptr && message->err == RD_KAFKA_RESP_ERR_NO_ERROR) {
        ++keys[std::string(static_cast<const char*>(message->key), message->key_len)];
        lastBody_.assign(static_cast<const char*>(message->payload), message->len);
        rd_kafka_headers_t* headers = nullptr;
        const void* value = nullptr;
        size_t size = 0;
        if (rd_kafka_message_headers(message, &headers) == RD_KAFKA_RESP_ERR_NO_ERROR &&
            rd_kafka_header_get_last(headers, "Kyt-Path", &value, &size) == RD_KAFKA_RESP_ERR_NO_ERROR)
          lastPath_.assign(static_cast<const char*>(value), size);
      }
      if (message != nullptr) rd_kafka_message_destroy(message);
      return keys.size() >= count;
    })) << receiver_->output();
    rd_kafka_consumer_close(consumer);
    rd_kafka_destroy(consumer);
    return keys;
  }
  void setBrokers(bool areUp) {
    for (int i = 1; i <= kBrokers; ++i)
      ASSERT_EQ(areUp ? rd_kafka_mock_broker_set_up(cluster_, i) : rd_kafka_mock_broker_set_down(cluster_, i),
                RD_KAFKA_RESP_ERR_NO_ERROR);
  }

  rd_kafka_t* host_ = nullptr;  // has the cluster in it
  rd_kafka_mock_cluster_t* cluster_ = nullptr;
  std::optional<ReceiverProcess> receiver_;
  std::string lastBody_, lastPath_;
};

TEST_F(ReceiverOnKafka, AnswersOnceABrokerHasThePostUnderItsID) {
  const std::string body = gzipped(postText(1));
  EXPECT_EQ(receiver_->post(body, {"Content-Encoding: gzip"}).status, 200);
  EXPECT_EQ(receiver_->metric("kyt_posts_total{result=\"stored\"}"), 1);
  const auto keys = read(1);
  EXPECT_EQ(keys.size(), 1U);
  EXPECT_EQ(keys.begin()->first.size(), 64U);
  EXPECT_EQ(lastBody_, body);
  EXPECT_EQ(lastPath_, "/v1/events");
}

TEST_F(ReceiverOnKafka, KeepsPostsWhileTheBrokersAreAway) {
  EXPECT_EQ(receiver_->post(postText(0)).status, 200);
  setBrokers(false);
  for (uint64_t i = 1; i <= 5; ++i) EXPECT_EQ(receiver_->post(postText(i)).status, 200);
  EXPECT_GE(receiver_->metric("kyt_posts_total{result=\"spooled\"}"), 4);
  setBrokers(true);
  EXPECT_EQ(read(6).size(), 6U);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_spool_posts") == 0; })) << receiver_->output();
}

TEST_F(ReceiverOnKafka, RefusesForGoodWhatTheBrokersFindTooLarge) {
  rd_kafka_mock_push_request_errors(cluster_, 0 /* Produce */, 1, RD_KAFKA_RESP_ERR_MSG_SIZE_TOO_LARGE);
  EXPECT_EQ(receiver_->post(postText(1)).status, 413);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"too-large-for-log\"}"), 1);
  EXPECT_EQ(receiver_->post(postText(2)).status, 200);
  EXPECT_EQ(receiver_->metric("kyt_spool_posts"), 0);
}

TEST_F(ReceiverOnKafka, OutlastsABrokerThatHasLostItsOrder) {
  ASSERT_EQ(receiver_->post(postText(1)).status, 200);
  rd_kafka_mock_push_request_errors(cluster_, 0 /* Produce */, 2,
                                    RD_KAFKA_RESP_ERR_OUT_OF_ORDER_SEQUENCE_NUMBER,
                                    RD_KAFKA_RESP_ERR_OUT_OF_ORDER_SEQUENCE_NUMBER);
  for (uint64_t i = 2; i <= 5; ++i) EXPECT_EQ(receiver_->post(postText(i)).status, 200);
  EXPECT_EQ(read(5).size(), 5U);
  EXPECT_TRUE(eventually([&] { return receiver_->metric("kyt_spool_posts") == 0; })) << receiver_->output();
}

TEST_F(ReceiverOnKafka, OutlastsErrorsOfTheBrokers) {
  rd_kafka_mock_push_request_errors(cluster_, 0 /* Produce */, 3, RD_KAFKA_RESP_ERR_NOT_ENOUGH_REPLICAS,
                                    RD_KAFKA_RESP_ERR_REQUEST_TIMED_OUT,
                                    RD_KAFKA_RESP_ERR_NOT_LEADER_FOR_PARTITION);
  EXPECT_EQ(receiver_->post(postText(1)).status, 200);
  EXPECT_EQ(read(1).size(), 1U);
}

TEST(ReceiverForKafka, SaysWhichLineOfTheLibrarysSettingsIsWrong) {
  const TemporaryFolder folder;
  for (const auto& [settings, complaint] :
       {std::pair("# of the library\n\nsasl.username\n", ":3: a line must be NAME=VALUE"),
        std::pair("client.id=a\nsasl.usernme=b\n", ":2: No such configuration property: \"sasl.usernme\"")}) {
    const std::string credentials = folder.write("credentials", settings);
    const std::string file =
        folder.write("r.toml", "[log]\nkind = \"kafka\"\nservers = [\"127.0.0.1:1\"]\ncredentials = \"" +
                                   credentials + "\"\n[spool]\npath = \"" + folder.path() +
                                   "/spool\"\n[[path]]\nurl_path = \"/v1/events\"\n");
    tools::ChildProcess::Options how;
    how.outputFile = folder / "output";
    auto started = tools::ChildProcess::start(KYT_RECEIVER, {"--config", file}, how);
    ASSERT_TRUE(started);
    EXPECT_EQ(started->wait(kTestDeadline), 1);
    EXPECT_NE(folder.read("output").find(credentials + complaint), std::string::npos)
        << folder.read("output");
  }
}

}  // namespace
}  // namespace kyt::receiver
