// From the records to the request: the message's text, its compression, its headers and its digest. Takes what it needs
// by value and nothing of the back end or its session, so it may run on any thread. Used by HTTPSPostBackend.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "backend/SessionFacts.h"
#include "config/Configuration.h"
#include "platform/URLSession.h"
#include "platform/objects/Value.h"

namespace kyt {

class UserAccount;

// What a back end knows at the moment at which it decides to post.
struct PostFacts {
  SharedSessionFacts session;
  std::optional<String> clientID;
  std::optional<String> clientName, serviceName;
  // The pretty text may be shown: by the user's consent (by which alone the events were collected), or by a setting of the
  // device, in some environments.
  bool consentShowsText = false, settingShowsText = false;
  bool shouldUseWiFiOnly = false;
  std::optional<Data> digestKey;
  int32_t digestAlgorithm = 0;
  std::shared_ptr<UserAccount> account;  // of whom the body is
  size_t sizeHint = 0;                   // of the message's text, in bytes
};

// What the request's header says of a message's one event.
struct EventMap {
  uint16_t method = 0, responseCode = 0;
};

class PostRequest {
 public:
  struct Message {
    std::string json;       // the body before compression
    size_t prettySize = 0;  // of its pretty text, in bytes
    size_t events = 0;      // records in the body: all, or none without a client ID
  };

  PostRequest(const Configuration& configuration, PostFacts facts);

  // Whether the message may be shown as a pretty text.
  [[nodiscard]] bool mayBeShown() const;
  [[nodiscard]] Message message(Array records) const;
  // The same message for people. Made of its text, so it costs little, and nothing where nobody asks.
  [[nodiscard]] static Value prettyText(std::string_view json);
  // `url` is as the storebag gives it.
  [[nodiscard]] URLRequest request(const String& url, std::string json,
                                   const std::optional<EventMap>& eventMap) const;

 private:
  void removeUnpostable(Dictionary& record) const;
  [[nodiscard]] std::string addressWithForcedScheme(const String& url) const;
  [[nodiscard]] std::string digestOfBody(const Data& body) const;

  const Configuration configuration_;
  const PostFacts facts_;
};

}  // namespace kyt
