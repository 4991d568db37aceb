// One file's upload: what is refused before anything is sent, what is sent, and what a reply means.
#include "backends/upload/UploadBackend.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <utility>

#include "platform/objects/Keys.h"
#include "platform/queues/SerialQueue.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

// Answers each request on a thread of its own, as a URL session's queue does.
class ThreadedPoster final : public ReportingSessionConnectivityInterface {
 public:
  using Answer = std::function<void(URLCompletion&)>;
  explicit ThreadedPoster(Answer answer) : answer_(std::move(answer)) {}
  void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion completion) override {
    requests.push_back(std::move(request));
    threads_.emplace_back([this, completion = std::move(completion)]() mutable { answer_(completion); });
  }
  std::vector<URLRequest> requests;

 private:
  const Answer answer_;
  std::vector<std::jthread> threads_;
};

ThreadedPoster::Answer reply(std::string text, int status = 200) {
  return [text = std::move(text), status](URLCompletion& completion) {
    URLResponse response;
    response.status = status;
    completion(Data(std::string_view(text)), response, std::nullopt);
  };
}

std::string unzipped(const Data& body) {
  z_stream stream = {};
  EXPECT_EQ(inflateInit2(&stream, 31), Z_OK);
  std::string out(1 << 20, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.view().data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  EXPECT_EQ(inflate(&stream, Z_FINISH), Z_STREAM_END);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return out;
}

class Upload : public testing::Test {
 protected:
  UploadBackend& backend() {
    if (backend_ == nullptr) {
      SessionFacts facts;
      facts.sessionID = 4294967295U;
      facts.udid = String(udid_);
      facts.productFamily = String("Phone");
      backend_ = UploadBackend::initWithName(platform_.configuration, kKYTReportingBackendUploadServer,
                                             profile_, std::make_shared<SessionFacts>(facts));
      backend_->setReportingSessionConnectivityDelegate(poster_);
    }
    return *backend_;
  }
  bool upload(const char* path = "/tmp/report.log", const char* token = "token") {
    FileOffer offer(std::nullopt);
    const bool sent = backend().uploadFileAtPath(path, token, offer);
    EXPECT_EQ(platform_.fileExtensions.held, 0) << "the access is still held";
    return sent;
  }
  void answer(ThreadedPoster::Answer how) { poster_ = std::make_shared<ThreadedPoster>(std::move(how)); }
  bool logged(LogLevel level, std::string_view line) { return platform_.sink.contains(level, line); }
  const std::vector<std::string>& removed() { return platform_.fileExtensions.removed; }

  TestPlatform platform_;
  std::shared_ptr<ThreadedPoster> poster_ = std::make_shared<ThreadedPoster>(reply("{}"));
  Dictionary profile_{{"post_url", "https://upload.example.org/in"}, {"display_url", "https://show"}};
  const char* udid_ = "0123456789abcdef";
  std::shared_ptr<UploadBackend> backend_;
};

TEST_F(Upload, NeedsAnAddress) {
  for (const Dictionary& profile : {Dictionary{}, Dictionary{{"post_url", 7}}}) {
    platform_.sink.clear();
    EXPECT_EQ(UploadBackend::initWithName(platform_.configuration, "uploadserver", profile,
                                          std::make_shared<SessionFacts>()),
              nullptr);
    EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(initWithName): can't resolve upload post URL."));
  }
}

TEST_F(Upload, TakesItsAddressesFromTheProfile) {
  EXPECT_EQ(backend().uploadURL(), String("https://upload.example.org/in"));
  EXPECT_EQ(backend().displayURL(), String("https://show"));
  EXPECT_EQ(backend().facts().productFamily, String("Phone"));
}

TEST_F(Upload, TakesNoEvents) {
  EXPECT_TRUE(backend().sendMessage(Dictionary{{"a", 1}}, TimeValue{}, 1, 2, MessageFlag{3}).isNull());
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(Upload, SendsTheWholeFileCompressed) {
  EXPECT_TRUE(upload());
  ASSERT_EQ(poster_->requests.size(), 1u);
  const URLRequest& request = poster_->requests[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.url,
            "https://upload.example.org/in?uuid=0123456789abcdef&sequence=4294967295"
            "&description=Vidcall%20AFRC%20log%20(Uploaded%20by%20TQS)&filename=report.log.gz&raw=true");
  EXPECT_EQ(request.headers,
            (std::vector<std::pair<std::string, std::string>>{{"Content-Type", "application/octet-stream"},
                                                              {"Content-Encoding", "gzip"}}));
  EXPECT_EQ(unzipped(request.body), "contents");
  EXPECT_TRUE(request.isAwaited);
  EXPECT_TRUE(logged(LogLevel::normal, "UploadBackend(uploadFileAtPath): Uploading file /tmp/report.log"));
}

TEST_F(Upload, ARepliesSuccessRemovesTheFile) {
  answer(reply(R"({"status":"success"})"));
  EXPECT_TRUE(upload("/tmp/a b.log"));
  EXPECT_EQ(removed(), std::vector<std::string>{"a b.log"});
  EXPECT_NE(poster_->requests[0].url.find("&filename=a%20b.log.gz&"), std::string::npos);
  EXPECT_TRUE(logged(LogLevel::normal,
                     "UploadBackend(uploadFileAtPath): sending to |https://upload.example.org/in|, "
                     "Json output: {\"status\":\"success\"}"));
}

TEST_F(Upload, AFileThatCannotBeRemovedIsUploadedAllTheSame) {
  platform_.fileExtensions.removable = false;
  answer(reply("success"));
  EXPECT_TRUE(upload());
  EXPECT_EQ(removed().size(), 1u);
  EXPECT_EQ(platform_.sink.count(LogLevel::error, "UploadBackend"), 0u);
}

TEST_F(Upload, AnyReplyWithoutThatWordKeepsTheFile) {
  for (const char* text : {"", "{}", "{\"status\":\"Success\"}", "succes"}) {
    backend_ = nullptr;
    answer(reply(text));
    EXPECT_TRUE(upload()) << text;
    EXPECT_TRUE(removed().empty()) << text;
  }
}

TEST_F(Upload, OnlyTheWordCountsAndNotTheStatus) {
  answer(reply("success", 500));
  EXPECT_TRUE(upload());
  EXPECT_EQ(removed().size(), 1u);
}

TEST_F(Upload, AReplyThatIsNoTextKeepsTheFile) {
  answer(reply("success\xff"));
  EXPECT_TRUE(upload());
  EXPECT_TRUE(removed().empty());
  EXPECT_TRUE(logged(LogLevel::normal,
                     "UploadBackend(uploadFileAtPath): sending to |https://upload.example.org/in|, "
                     "Json output: (null)"));
}

TEST_F(Upload, AFailedPostKeepsTheFileAndIsStillTrue) {
  answer([](URLCompletion& completion) {
    completion(std::nullopt, std::nullopt, Error{kKYTURLErrorDomain, 7, "no route to success"});
  });
  EXPECT_TRUE(upload());
  EXPECT_TRUE(removed().empty());
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): post no route to success"));
  EXPECT_EQ(platform_.counters.value(Reason::postFailed), 1u);
}

TEST_F(Upload, AReplyThatCameCountsWhateverErrorCameWithIt) {
  answer([](URLCompletion& completion) {
    completion(Data(std::string_view("success")), std::nullopt, Error{kKYTURLErrorDomain, 18, "cut off"});
  });
  EXPECT_TRUE(upload());
  EXPECT_EQ(removed().size(), 1u);
  EXPECT_EQ(platform_.sink.count("UploadBackend(uploadFileAtPath): post"), 0u);
}

TEST_F(Upload, AReplyWithoutDataAndErrorIsAFailedPost) {
  answer([](URLCompletion& completion) { completion(std::nullopt, URLResponse(), std::nullopt); });
  EXPECT_TRUE(upload());
  EXPECT_TRUE(removed().empty());
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): post (null)"));
}

TEST_F(Upload, WithoutAPosterNothingIsSentAndItIsStillTrue) {
  static_cast<void>(backend());
  poster_.reset();
  EXPECT_TRUE(upload());
  EXPECT_TRUE(removed().empty());
  EXPECT_EQ(platform_.counters.value(Reason::postWithoutPoster), 1u);
}

TEST_F(Upload, WithoutAnAddressTheTokenIsNotConsumed) {
  backend().setUploadURL(std::nullopt);
  EXPECT_FALSE(upload());
  EXPECT_TRUE(logged(LogLevel::normal, "UploadBackend(uploadFileAtPath): Uploading file /tmp/report.log"));
  EXPECT_TRUE(platform_.fileExtensions.tokens.empty());
}

TEST_F(Upload, ATokenThatGrantsNothingIsRefused) {
  platform_.fileExtensions.grants = false;
  EXPECT_FALSE(upload());
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Only upload a regular file."));
  EXPECT_EQ(platform_.fileExtensions.tokens, std::vector<std::string>{"token"});
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(Upload, OnlyARegularFileIsUploaded) {
  platform_.fileExtensions.regular = false;
  EXPECT_FALSE(upload());
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Only upload a regular file."));
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(Upload, AnEmptyFileIsRefusedAndKept) {
  platform_.fileExtensions.contents.clear();
  answer(reply("success"));
  EXPECT_FALSE(upload());
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Input file is empty"));
  EXPECT_TRUE(removed().empty());
}

TEST_F(Upload, AFileThatCannotBeReadCountsAsEmpty) {
  platform_.fileExtensions.readable = false;
  EXPECT_FALSE(upload());
  EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Input file is empty"));
}

TEST_F(Upload, AFileOverTheLimitIsRefusedAndCounted) {
  platform_.limits.maxUploadBytes = 8;
  EXPECT_TRUE(upload());
  platform_.limits.maxUploadBytes = 7;
  EXPECT_FALSE(upload());
  EXPECT_FALSE(upload());
  EXPECT_EQ(platform_.counters.value(Reason::uploadTooLarge), 2u);
  EXPECT_EQ(platform_.sink.count(LogLevel::error,
                                 "UploadBackend(uploadFileAtPath): Input file is over the limit of 7 bytes"),
            1u);
}

TEST_F(Upload, AFileOfAUserWhoseFilesFillTheMemoryIsRefusedAndCounted) {
  platform_.fileExtensions.roomForMore = false;
  EXPECT_FALSE(upload());
  EXPECT_FALSE(upload());
  EXPECT_TRUE(poster_->requests.empty());
  EXPECT_TRUE(removed().empty());
  EXPECT_EQ(platform_.counters.value(Reason::tooMuchUploadedAtOnce), 2u);
  EXPECT_EQ(
      platform_.sink.count(LogLevel::error,
                           "UploadBackend(uploadFileAtPath): Input file refused, too much of its user is "
                           "being uploaded"),
      1u);
}

TEST_F(Upload, OnlyTheCompressedFileIsHeldWhileTheServerIsWaitedFor) {
  platform_.fileExtensions.contents = std::string(100000, 'x');
  EXPECT_TRUE(upload());
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_EQ(platform_.fileExtensions.heldBytes, poster_->requests[0].body.size());
}

TEST_F(Upload, AFileThatCannotBeCompressedIsRefused) {
  platform_.deflate.faults.initialize = -4;
  EXPECT_FALSE(upload());
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(Upload, AnAddressThatIsNoneMakesNoRequest) {
  for (const char* url : {"",
                          "upload.example.org",
                          "ftp://x/",
                          "https://",
                          "https:///in",
                          "https://?a",
                          "http://a b/",
                          "http://a\x7f/",
                          "://a/",
                          "https://a:70000/",
                          "https://a:in/",
                          "https://user@/in",
                          "https://[::1",
                          "https://[]/",
                          "https://:443/",
                          "https://a/%",
                          "https://a/%4",
                          "https://a/%zz",
                          "https://a/\xc3\xbc",
                          "https://a/<in>",
                          "https://a/\"in\"",
                          "https://a/{in}",
                          "https://a/in|out",
                          "https://a\\in",
                          "https://a/^",
                          "https://a/`",
                          "https://a/[in]",
                          "https://a[1]/",
                          "https://[::1]]/",
                          "https://[[::1]/",
                          "https://[u]@a/",
                          "https://a/#in#out"}) {
    backend_ = nullptr;
    platform_.sink.clear();
    profile_.set("post_url", url);
    EXPECT_FALSE(upload()) << url;
    EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Unable to create URL request"))
        << url;
  }
  EXPECT_TRUE(poster_->requests.empty());
}

// Not what "post_url" says alone.
TEST_F(Upload, TheFinishedAddressIsJudged) {
  for (const char* url : {"https://upload.example.org", "https://a:/in", "https://[2001:db8::1]:8443/in",
                          "https://user:word@a:443", "https://a/x%20y", "https://a/-._~!$&'()*+,;=:@",
                          "https://user:word@[::1]:443/", "https://a/in#part"}) {
    backend_ = nullptr;
    platform_.sink.clear();
    profile_.set("post_url", url);
    EXPECT_TRUE(upload()) << url;
  }
  EXPECT_EQ(poster_->requests.size(), 8u);
}

// What stands behind a "post_url" that is an address by itself.
TEST_F(Upload, AnIdentifierThatCanStandInNoAddressMakesNoRequest) {
  for (const char* udid : {"a b", "a\n", "a\x7f", "50%", "%zz"}) {
    platform_.sink.clear();
    backend_ = nullptr;
    udid_ = udid;
    EXPECT_FALSE(upload()) << udid;
    EXPECT_TRUE(logged(LogLevel::error, "UploadBackend(uploadFileAtPath): Unable to create URL request"))
        << udid;
  }
  EXPECT_TRUE(poster_->requests.empty());
  backend_ = nullptr;
  udid_ = "a%20b";
  EXPECT_TRUE(upload());
}

TEST_F(Upload, ASchemeMayBeInCapitals) {
  profile_.set("post_url", "HTTPS://upload.example.org/in");
  EXPECT_TRUE(upload());
  ASSERT_EQ(poster_->requests.size(), 1u);
  EXPECT_TRUE(poster_->requests[0].url.starts_with("HTTPS://upload.example.org/in?uuid="));
}

// The server does not answer: the thread waits, and says so to the pool that it belongs to.
TEST_F(Upload, BlocksItsWorkerUntilTheReplyAndLetsOthersRun) {
  std::atomic<bool> released{false};
  answer([&](URLCompletion& completion) {
    EXPECT_TRUE(eventually([&] { return released.load(); }));
    reply("success")(completion);
  });
  static_cast<void>(backend());
  WorkerPoolOptions options;
  options.runnable = 1;
  WorkerPool pool(options);
  const auto uploads = SerialQueue::create("uploads", pool), others = SerialQueue::create("others", pool);
  std::atomic<bool> uploaded{false}, otherRan{false};
  uploads->async([&] { uploaded = upload(); });
  ASSERT_TRUE(eventually([&] { return platform_.fileExtensions.held == 1; }));
  others->async([&] { otherRan = true; });
  EXPECT_TRUE(eventually([&] { return otherRan.load(); }));
  EXPECT_FALSE(uploaded);
  released = true;
  EXPECT_TRUE(eventually([&] { return uploaded.load(); }));
  EXPECT_EQ(removed(), std::vector<std::string>{"report.log"});
  pool.shutDown();
}

// A large file is compressed for seconds: with one worker that may run, another session's work does not wait
// for it.
TEST_F(Upload, LetsOthersRunWhileItCompresses) {
  std::atomic<bool> compressing{false}, otherRan{false}, othersRanMeanwhile{false};
  platform_.deflate.faults.beforeFinish = [&] {
    compressing = true;
    othersRanMeanwhile = eventually([&] { return otherRan.load(); });
  };
  answer(reply("success"));
  static_cast<void>(backend());
  WorkerPoolOptions options;
  options.runnable = 1;
  WorkerPool pool(options);
  const auto uploads = SerialQueue::create("uploads", pool), others = SerialQueue::create("others", pool);
  std::atomic<bool> uploaded{false};
  uploads->async([&] { uploaded = upload(); });
  ASSERT_TRUE(eventually([&] { return compressing.load(); }));
  others->async([&] { otherRan = true; });
  EXPECT_TRUE(eventually([&] { return uploaded.load(); }));
  EXPECT_TRUE(othersRanMeanwhile);
  pool.shutDown();
}

TEST(PercentEncodedForQuery, KeepsWhatAQueryMayHold) {
  const std::string allowed = "ABCXYZabcxyz0189-._~!$&'()*+,;=:@/?";
  EXPECT_EQ(percentEncodedForQuery(allowed), allowed);
  EXPECT_EQ(percentEncodedForQuery(" \"#%<>[\\]^`{|}\x7f\n"),
            "%20%22%23%25%3C%3E%5B%5C%5D%5E%60%7B%7C%7D%7F%0A");
  EXPECT_EQ(percentEncodedForQuery("\xc3\xa9"), "%C3%A9");
}

TEST(LastPathComponent, IsWhatStandsBehindTheLastSlash) {
  EXPECT_EQ(lastPathComponent("/tmp/report.log"), "report.log");
  EXPECT_EQ(lastPathComponent("/tmp/folder//"), "folder");
  EXPECT_EQ(lastPathComponent("report"), "report");
  EXPECT_EQ(lastPathComponent("/"), "/");
  EXPECT_EQ(lastPathComponent(""), "");
}

TEST_F(Upload, TellsTheOwnerOfAFileThatLeft) {
  auto program = std::make_shared<ReportingProgram>();
  program->user = 1001;
  backend().setProgram(program);
  EXPECT_TRUE(upload());
  const auto left = platform_.departures.all();
  ASSERT_EQ(left.size(), 1U);
  EXPECT_EQ(left[0].kind, DepartureKind::file);
  EXPECT_EQ(left[0].program.user, 1001U);
  EXPECT_EQ(left[0].server, "https://upload.example.org");
  EXPECT_EQ(left[0].bytes, poster_->requests[0].body.size());
  EXPECT_TRUE(left[0].isAnswered);
}

TEST_F(Upload, TellsTheOwnerNothingOfAFileThatCouldNotLeave) {
  answer([](URLCompletion& completion) {
    completion(std::nullopt, std::nullopt, Error{kKYTURLErrorDomain, 6, "no such host"});
  });
  EXPECT_TRUE(upload());
  EXPECT_TRUE(platform_.departures.all().empty());
}

}  // namespace
}  // namespace kyt
