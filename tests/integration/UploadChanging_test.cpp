// Files that their clients go on writing, or cut, while the daemon reads and sends them: what arrives is a request
// whose length is right, whole in itself, with bytes that were in the file. The exact moments are chosen in
// tests/linux/helpers/LinuxFileExtensions_test.cpp; here a writer does not stop.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kCadmor = 20, kRounds = 8;
constexpr size_t kStart = 3 << 20, kLeast = 10;

// The text of a gzip stream that is whole and has nothing behind it; otherwise "(broken)".
std::string unzipped(const std::string& body) {
  z_stream stream = {};
  if (inflateInit2(&stream, 31) != Z_OK) return "(broken)";
  std::string out;
  std::vector<char> piece(1 << 20);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  int status = Z_OK;
  while (status == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(piece.data());
    stream.avail_out = static_cast<uInt>(piece.size());
    status = inflate(&stream, Z_NO_FLUSH);
    out.append(piece.data(), piece.size() - stream.avail_out);
  }
  inflateEnd(&stream);
  return status == Z_STREAM_END && stream.avail_in == 0 ? out : "(broken)";
}

std::string pattern(size_t size) {
  std::string text;
  for (size_t i = 0; text.size() < size; ++i) text += std::to_string(i) + "\n";
  text.resize(size);
  return text;
}

class ChangingUploads : public testing::Test {
 protected:
  void SetUp() override {
    const Dictionary bag{
        {"version", "1"},
        {"vantu_internal", Dictionary{{"uploadserver", Dictionary{{"post_url", server_.url("/upload")}}}}}};
    server_.setHandler([document = signedBag(bag, propertyLists_)](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      reply.body = request.method == "GET" ? document : "success";
      return reply;
    });
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  }
  void TearDown() override {
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  // Uploads files one after the other, each while `change` works on it again and again; the texts that arrived.
  std::vector<std::string> uploadWhile(const std::function<void(int descriptor)>& change) {
    TestClient client(daemon_.socketPath(), kCadmor);
    EXPECT_EQ(client.configure(), "live: uploadserver") << daemon_.log();
    for (int round = 0; round < kRounds; ++round) {
      const std::string file = files_.write("log" + std::to_string(round), start_);
      std::atomic<int> changes{0};
      std::jthread writer([&](const std::stop_token& stop) {
        const Descriptor out = ownDescriptor(::open(file.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC));
        for (; !stop.stop_requested(); ++changes) change(out.get());
      });
      EXPECT_TRUE(eventually([&] { return changes > 0; }));
      auto answer = std::make_shared<std::promise<std::string>>();
      client->uploadFile(file, [answer](bool success, const std::optional<Error>& error) {
        answer->set_value(error ? error->localizedDescription : success ? "yes" : "no");
      });
      EXPECT_EQ(TestClient::waitFor(answer), "yes") << daemon_.log();
      EXPECT_FALSE(std::filesystem::exists(file)) << "the server has it\n" << daemon_.log();
    }
    EXPECT_TRUE(client.finish());
    std::vector<std::string> texts;
    for (const TestHTTPServer::Request& request : server_.requests()) {
      if (request.method != "POST") continue;
      EXPECT_EQ(request.headerCount("Content-Length"), 1u);
      EXPECT_EQ(request.header("Content-Length"), std::to_string(request.body.size()));
      EXPECT_EQ(request.headerCount("Transfer-Encoding"), 0u);
      texts.push_back(unzipped(request.body));
    }
    return texts;
  }

  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_{server_.url("")};
  const TemporaryFolder files_;
  const std::string start_ = pattern(kStart);
};

TEST_F(ChangingUploads, AFileThatGrowsArrivesAsLongAsItWas) {
  const std::string more(1000, '#');
  const std::vector<std::string> texts = uploadWhile([&](int file) {
    // A daemon that is slow to look must not find a file over its limit.
    if (::lseek(file, 0, SEEK_END) > static_cast<off_t>(4 * kStart)) return std::this_thread::yield();
    EXPECT_EQ(::write(file, more.data(), more.size()), static_cast<ssize_t>(more.size()));
  });
  ASSERT_EQ(texts.size(), static_cast<size_t>(kRounds));
  for (const std::string& text : texts) {
    ASSERT_GT(text.size(), kStart);
    EXPECT_EQ(text.compare(0, kStart, start_), 0);
    EXPECT_EQ(text.find_first_not_of('#', kStart), text.npos);
  }
}

TEST_F(ChangingUploads, AFileThatIsCutAndGrowsArrivesWithNothingThatWasNeverInIt) {
  const std::string more(kStart, '#');
  const std::vector<std::string> texts = uploadWhile([&](int file) {
    EXPECT_EQ(::ftruncate(file, kLeast), 0);
    EXPECT_EQ(::write(file, more.data(), more.size()), static_cast<ssize_t>(more.size()));
  });
  ASSERT_EQ(texts.size(), static_cast<size_t>(kRounds));
  for (const std::string& text : texts) {
    ASSERT_GE(text.size(), kLeast);
    ASSERT_LE(text.size(), kLeast + kStart);
    EXPECT_EQ(text.substr(0, kLeast), start_.substr(0, kLeast));
    // What was appended, and holes where it was just cut off.
    EXPECT_EQ(text.find_first_not_of(std::string_view("#\0", 2), kLeast), text.npos);
  }
}

}  // namespace
}  // namespace kyt
