// Sends the worked examples of docs/WIRE-DASHBOARD.md and docs/WIRE-LOGDATA.md, and compares what goes out with
// the documents.
#include <fstream>
#include <sstream>

#include "platform/objects/KeyedArchive.h"
#include "tests/backends/dashboard/DashboardFixture.h"

namespace kyt {
namespace {

class DashboardWireExample : public DashboardFixture {
 protected:
  // The text of the fenced block with that label.
  static std::string block(const std::string& file, const std::string& label) {
    std::ifstream stream(KYT_DOCS_DIR "/" + file);
    std::ostringstream text;
    text << stream.rdbuf();
    const std::string document = text.str();
    const std::string fence = "```" + label + "\n";
    const size_t start = document.find(fence);
    if (start == std::string::npos) return "no block " + label;
    const size_t begin = start + fence.size();
    return document.substr(begin, document.find("\n```", begin) - begin);
  }
  // Sixteen bytes a line.
  static std::string hex(std::string_view bytes) {
    std::string out;
    for (size_t i = 0; i < bytes.size(); ++i) {
      char digits[3];
      std::snprintf(digits, sizeof digits, "%02x", static_cast<unsigned char>(bytes[i]));
      if (i != 0) out += i % 16 == 0 ? '\n' : ' ';
      out += digits;
    }
    return out;
  }
};

TEST_F(DashboardWireExample, TheDatagramIsWhatIsSent) {
  const std::string file = "WIRE-DASHBOARD.md";
  const std::string device = block(file, "text device");
  const auto message = platform_.json.parse(block(file, "json message"));
  ASSERT_TRUE(std::holds_alternative<Value>(message));
  facts_.sessionID = 77;
  facts_.udid = String(device);
  ASSERT_NE(make(reliable()), nullptr);
  EXPECT_EQ(send(4, *std::get<Value>(message).dictionary(), {1769860800, 987654}), block(file, "text line"));
  EXPECT_EQ(hex(socket().sent.at(0)), block(file, "hex datagram"));
}

TEST_F(DashboardWireExample, TheLogDataIsWhatIsPosted) {
  const std::string raw("\x00\xff\x10\xa5", 4);
  const Array entries{
      Dictionary{{"text", "it went wrong"}, {"level", 3}, {"offset", -1}, {"exact", true}, {"share", 0.25}},
      Dictionary{{"time", Date{1769860800}}, {"raw", Data(raw)}},
      Dictionary{{"time", Date{1769860800.5}}, {"text", nullptr}}};
  const auto poster = std::make_shared<AnsweringPoster>();
  ASSERT_NE(make(profile({{"post_url", "https://logs.example.org"}})), nullptr);
  backend_->setReportingSessionConnectivityDelegate(poster);
  EXPECT_TRUE(backend_->uploadLogData(entries));
  const std::string body(poster->requests.at(0).body.view());
  EXPECT_EQ(hex(body), block("WIRE-LOGDATA.md", "hex body"));
  const auto read = unarchivedObject(body);
  ASSERT_TRUE(std::holds_alternative<Value>(read));
  EXPECT_EQ(std::get<Value>(read), Value(entries));
}

}  // namespace
}  // namespace kyt
