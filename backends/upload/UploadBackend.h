// The back end that uploads one whole file, compressed, with one POST to the server that its profile names,
// and has the file removed when the reply says "success". It takes no events: its send operations are the
// base's, which do nothing. Made by the factory, owned by one session.
//
// Threads: called on its session's queue. uploadFileAtPath() blocks that thread, without a time-out, until the
// reply is there; so it must not be called on the queue that replies are delivered on.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "backend/KYTReportingBackend.h"
#include "config/Configuration.h"

namespace kyt {

class UploadBackend : public KYTReportingBackend {
 public:
  // Null, with a line in the log, when the profile has no "post_url".
  static std::shared_ptr<UploadBackend> initWithName(Configuration& configuration, String name,
                                                     Dictionary profile, SharedSessionFacts facts);
  UploadBackend(Making, Platform& platform, String name, Dictionary profile, SharedSessionFacts facts,
                String uploadURL);

  // True once a request was built and handed to the poster, whatever the server then answers.
  [[nodiscard]] bool uploadFileAtPath(const String& path, const String& extensionToken,
                                      FileOffer& offer) override;

  [[nodiscard]] const std::optional<String>& uploadURL() const { return uploadURL_; }
  void setUploadURL(std::optional<String> value) { uploadURL_ = std::move(value); }

 private:
  [[nodiscard]] std::optional<Data> compressedFile(FileAccess& file);
  [[nodiscard]] std::optional<URLRequest> newRequest(std::string_view fileName, Data body) const;
  // Blocks until the reply is there; whether it asks for the file's removal.
  [[nodiscard]] bool post(ReportingSessionConnectivityInterface& poster, URLRequest request);

  std::optional<String> uploadURL_;
};

// Characters that may stand in a URL's query stay; every other byte becomes %XX. '&', '=' and '+' are among
// those that stay, deliberately: servers expect names as they were always sent.
[[nodiscard]] std::string percentEncodedForQuery(std::string_view text);
// What stands behind the last slash, slashes at the end left aside.
[[nodiscard]] std::string_view lastPathComponent(std::string_view path);

}  // namespace kyt
