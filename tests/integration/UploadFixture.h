// The daemon with an upload server behind it, and a client that makes its calls byte by byte, so that it passes as
// its file whatever it likes.
#pragma once

#include <fcntl.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/PlainClient.h"

namespace kyt {

// A session whose back ends take files. Usable in a process that was forked: it starts no thread.
class PlainUploader {
 public:
  static constexpr int kClientType = 20;

  explicit PlainUploader(const std::string& socket) : client_(socket) {
    if (!client_.connected() || !client_.shakeHands()) return;
    const Dictionary info{{kKYTReportingSessionInfoSessionID, 7},
                          {kKYTReportingSessionInfoClientType, kClientType},
                          {kKYTReportingSessionInfoBatchEvent, true},
                          {kKYTReportingSessionInfoRequireUserInfo, true}};
    const Dictionary user{{kKYTReportingUserInfoClientName, "uploading"},
                          {kKYTReportingUserInfoServiceName, "test"}};
    client_.call(
        "SetSessionInfo", "a{sv}aa{sv}avb",
        [&](MessageWriter& out) {
          out.writeDictionary(info);
          out.writeOptionalDictionary(user);
          out.writeArray({});
          out.writeBoolean(false);
        },
        false);
    client_.call("StartConfigWithCompletionHandler");
    const auto states = client_.receive();
    configured_ = states && states->type != wire::MessageType::error;
  }
  [[nodiscard]] bool configured() const { return configured_; }

  // Descriptors: the file, its folder.
  void startUpload(const std::string& path, const std::vector<int>& descriptors,
                   std::string_view token = "token") {
    client_.call(
        "UploadFileAtPath", "ssah",
        [&](MessageWriter& out) {
          out.writeString("file://" + path);
          out.writeString(token);
          out.writeDescriptorIndexes(static_cast<uint32_t>(descriptors.size()));
        },
        true, descriptors);
  }
  // "yes", "no", or the error's name.
  std::string answer() {
    const auto message = client_.receive();
    if (!message) return "(end)";
    if (message->type == wire::MessageType::error) return std::string(message->errorName);
    BodyReader reader(*message);
    bool success = false;
    reader.readBoolean(success);
    return success ? "yes" : "no";
  }
  std::string upload(const std::string& path, const std::vector<int>& descriptors,
                     std::string_view token = "token") {
    startUpload(path, descriptors, token);
    return answer();
  }

 private:
  test::PlainClient client_;
  bool configured_ = false;
};

class UploadTest : public StageTest {
 protected:
  // Call after lay(): one bag with an upload server.
  void putUploadBag() {
    Dictionary backends = section({entry("uploading")});
    backends.set("uploadserver", Dictionary{{"post_url", stage_->httpsBase() + "/upload"}});
    const auto problem = stage_->putStorebag("cadmor", Dictionary{{"version", "1"}, {"release", backends}});
    ASSERT_FALSE(problem) << problem->localizedDescription;
  }
  // What the server kept under that name, whoever sent it; none when nothing came.
  [[nodiscard]] std::optional<std::string> received(const std::string& name) const {
    std::error_code none;
    for (const auto& found :
         std::filesystem::recursive_directory_iterator(stage_->folder() + "/server", none))
      if (found.is_regular_file() && found.path().filename() == name) return contents(found.path().string());
    return std::nullopt;
  }
  [[nodiscard]] static bool exists(const std::string& path) {
    return std::filesystem::exists(std::filesystem::symlink_status(path));
  }
  [[nodiscard]] static Descriptor opened(const std::string& path, int flags = O_RDONLY) {
    Descriptor descriptor = ownDescriptor(::open(path.c_str(), flags | O_CLOEXEC, 0600));
    EXPECT_GE(descriptor.get(), 0) << path;
    return descriptor;
  }
};

}  // namespace kyt
