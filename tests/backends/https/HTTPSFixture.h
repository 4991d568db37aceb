// What the tests of the HTTPS back end share: a storebag profile of one client entry that enables the back
// end, a session that fits it, and a poster that keeps the requests until a test answers them.
#pragma once

#include <gtest/gtest.h>
#include <zlib.h>

#include <memory>
#include <string>
#include <vector>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/objects/Keys.h"
#include "platform/queues/SerialQueue.h"
#include "tests/support/TestPlatform.h"

namespace kyt {

class RecordingPoster final : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion completion) override {
    requests.push_back(std::move(request));
    completions.push_back(std::move(completion));
  }
  void answer(size_t index, int status) {
    URLResponse response;
    response.status = status;
    completions.at(index)(Data(), response, std::nullopt);
  }
  // A reply that breaks off after its status.
  void breakOff(size_t index, int status, Error error) {
    URLResponse response;
    response.status = status;
    completions.at(index)(std::nullopt, response, std::move(error));
  }
  void fail(size_t index, Error error) {
    completions.at(index)(std::nullopt, std::nullopt, std::move(error));
  }
  std::optional<std::string> header(size_t index, std::string_view name) const {
    for (const auto& [key, value] : requests.at(index).headers)
      if (key == name) return value;
    return std::nullopt;
  }

  std::vector<URLRequest> requests;
  std::vector<URLCompletion> completions;
};

// What a flush told its completion.
struct FlushAnswer {
  int calls = 0;
  Value result;
  std::optional<Error> error;
  FlushCompletion completion() {
    return [this](Value value, std::optional<Error> e) {
      ++calls;
      result = std::move(value);
      error = std::move(e);
    };
  }
};

class HTTPSFixture : public testing::Test {
 protected:
  HTTPSFixture() {
    platform_.consent.setAllowed(true);
    platform_.deviceProperties.setCountryCode("US");
    facts_.sessionID = 77;
    facts_.compType = 6;
    facts_.clientVersion = 3;
    facts_.requireUserInfo = true;
    facts_.batchEvents = true;
    facts_.udid = String("0123456789012345678901234567890123456789");
    facts_.productVersion = String("17.1");
    facts_.buildVersion = String("21B74");
    facts_.hardwareType = String("Phone9,1");
    facts_.productFamily = String("Phone");
    facts_.setSelfVersion("8.0");
    facts_.setStartTimestamp({1000000020, 0});
  }

  // A back end of the profile {"clients": [entry_]} and the facts_, its state not yet decided.
  HTTPSPostBackend& backend() {
    if (backend_) return *backend_;
    return make(Array{entry_});
  }
  HTTPSPostBackend& make(Array clients) {
    Dictionary profile{{"clients", std::move(clients)}};
    profile.merge(profileExtras_);
    backend_ = HTTPSPostBackend::initWithName(platform_.configuration, String(kKYTReportingBackendHTTPPost),
                                              profile, std::make_shared<SessionFacts>(facts_));
    backend_->setUserInfoDict(userInfo_);
    backend_->setReportingSessionConnectivityDelegate(poster_);
    return *backend_;
  }
  // … and decided, which enables it unless a test changed the entry.
  HTTPSPostBackend& decided() {
    backend().updateState();
    return backend();
  }

  Value send(uint16_t method, Dictionary payload = {{"k", "v"}}, int32_t flag = 0, uint16_t respCode = 2) {
    const Dictionary message{{kKYTReportingMessageBlobClientData, std::move(payload)}};
    return backend().sendMessage(message, TimeValue{1000000025, 500000}, method, respCode, MessageFlag{flag});
  }
  // A request's body before compression.
  std::string body(size_t index) {
    std::string text(poster_->requests.at(index).body.view());
    return poster_->header(index, "Content-Encoding") == "gzip" ? unzipped(text) : text;
  }
  Value message(size_t index) {
    std::variant<Value, Error> parsed = platform_.json.parse(body(index));
    EXPECT_TRUE(std::holds_alternative<Value>(parsed)) << body(index);
    return std::holds_alternative<Value>(parsed) ? std::get<Value>(parsed) : Value();
  }
  // The records of a posted message.
  std::vector<Dictionary> events(size_t index) {
    std::vector<Dictionary> records;
    const Value posted = message(index);
    const Value* list = posted.dictionary() != nullptr ? posted.dictionary()->find("events") : nullptr;
    if (list == nullptr || list->array() == nullptr) return records;
    for (const Value& record : *list->array()) records.push_back(*record.dictionary());
    return records;
  }
  static std::string unzipped(const std::string& body);
  uint64_t dropped(Reason reason) const { return platform_.counters.value(reason); }

  TestPlatform platform_;
  std::shared_ptr<RecordingPoster> poster_ = std::make_shared<RecordingPoster>();
  SessionFacts facts_;
  Dictionary profileExtras_;
  std::optional<Dictionary> userInfo_ =
      Dictionary{{kKYTReportingUserInfoClientName, "a"}, {kKYTReportingUserInfoServiceName, "b"}};
  Dictionary entry_{{"client", "a"},
                    {"service", "b"},
                    {"locale_whitelist", Array{"US"}},
                    {"filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}}}},
                    {"sampling_threshold", 1.0},
                    {"event_threshold", 49},
                    {"post_url", "https://post.example.org/events"},
                    {"realtime_post_url", "https://post.example.org/realtime"}};
  std::shared_ptr<HTTPSPostBackend> backend_;
};

inline std::string HTTPSFixture::unzipped(const std::string& body) {
  std::string out(1 << 20, '\0');
  z_stream stream{};
  EXPECT_EQ(inflateInit2(&stream, 31), Z_OK);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  EXPECT_EQ(inflate(&stream, Z_FINISH), Z_STREAM_END);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return out;
}

}  // namespace kyt
