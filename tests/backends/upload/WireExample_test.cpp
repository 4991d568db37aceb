// Uploads the file of the worked example in docs/WIRE-UPLOAD.md, and compares the request with the document.
#include <gtest/gtest.h>
#include <zlib.h>

#include "backends/upload/UploadBackend.h"
#include "platform/objects/Keys.h"
#include "tests/support/DocumentBlock.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

class AnsweringPoster final : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest sent, URLCompletion completion) override {
    request = std::move(sent);
    completion(Data(std::string_view(documentBlock("WIRE-UPLOAD.md", "json reply"))), URLResponse{},
               std::nullopt);
  }
  URLRequest request;
};

std::string unzipped(std::string_view body) {
  z_stream stream = {};
  EXPECT_EQ(inflateInit2(&stream, 31), Z_OK);
  std::string out(1 << 16, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  EXPECT_EQ(inflate(&stream, Z_FINISH), Z_STREAM_END);
  EXPECT_EQ(stream.avail_in, 0U);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return out;
}

TEST(UploadWireExample, IsWhatIsSent) {
  const std::string file = documentBlock("WIRE-UPLOAD.md", "text file") + "\n";
  const auto poster = std::make_shared<AnsweringPoster>();
  TestPlatform platform;
  platform.fileExtensions.contents = file;
  SessionFacts facts;
  facts.sessionID = 77;
  facts.udid = String(documentBlock("WIRE-UPLOAD.md", "text device"));
  const auto backend = UploadBackend::initWithName(platform.configuration, kKYTReportingBackendUploadServer,
                                                   Dictionary{{"post_url", "https://upload.example.org/in"}},
                                                   std::make_shared<SessionFacts>(facts));
  backend->setReportingSessionConnectivityDelegate(poster);
  FileOffer offer(std::nullopt);
  ASSERT_TRUE(backend->uploadFileAtPath("/tmp/reports/call #1.log", "token", offer));

  std::string request = poster->request.method + " " + poster->request.url;
  for (const auto& [name, value] : poster->request.headers) request += "\n" + name + ": " + value;
  EXPECT_EQ(request, documentBlock("WIRE-UPLOAD.md", "http request"));
  // Compressors differ in their bytes: the document's and the daemon's both give the file back.
  EXPECT_EQ(unzipped(poster->request.body.view()), file);
  EXPECT_EQ(unzipped(bytesOfHex(documentBlock("WIRE-UPLOAD.md", "hex body"))), file);
  EXPECT_EQ(platform.fileExtensions.removed, std::vector<std::string>{"call #1.log"});
}

}  // namespace
}  // namespace kyt
