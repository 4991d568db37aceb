// The contract between the daemon and its clients as one table: for each call its name on the wire, the signature of its
// arguments, and that of its reply. The server dispatches and replies by it, the client library calls and reads by it.
// docs/com.vantu.kytreportingd.xml tells everybody else the same; a test compares the two.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace kyt::wire {

// What a client calls on its session (ClientSessionInterface), the most frequent first.
enum class Method : uint8_t {
  sendMessageWithDictionary,
  setSessionInfo,
  startConfigWithCompletionHandler,
  fetchStatesWithUserInfo,
  fetchDisplayURL,
  flushMessagesWithCompletion,
  finishSessionGracefully,
  uploadFileAtPath,
  uploadLogData,
  sendMessageWithSessionInfo,
  updateSharedDataWithDictionary,
  updateSharedDataForKey,
  setDigestKey
};

struct MethodContract {
  Method method;
  std::string_view member, signature;
  std::string_view reply;  // empty: the reply says only that the call was handled
};

// Each method's row stands at its own number.
inline constexpr std::array kMethods{
    MethodContract{Method::sendMessageWithDictionary, "SendMessageWithDictionary", "a{sv}", "av"},
    MethodContract{Method::setSessionInfo, "SetSessionInfo", "a{sv}aa{sv}avb", ""},
    MethodContract{Method::startConfigWithCompletionHandler, "StartConfigWithCompletionHandler", "", "aas"},
    MethodContract{Method::fetchStatesWithUserInfo, "FetchStatesWithUserInfo", "aa{sv}", "aas"},
    MethodContract{Method::fetchDisplayURL, "FetchDisplayURL", "", "s"},
    MethodContract{Method::flushMessagesWithCompletion, "FlushMessagesWithCompletion", "", "ava(sis)"},
    MethodContract{Method::finishSessionGracefully, "FinishSessionGracefully", "", ""},
    MethodContract{Method::uploadFileAtPath, "UploadFileAtPath", "ssah", "b"},
    MethodContract{Method::uploadLogData, "UploadLogData", "av", "ba(sis)"},
    MethodContract{Method::sendMessageWithSessionInfo, "SendMessageWithSessionInfo", "a{sv}aa{sv}qqaa{sv}",
                   "s"},
    MethodContract{Method::updateSharedDataWithDictionary, "UpdateSharedDataWithDictionary", "a{sv}", ""},
    MethodContract{Method::updateSharedDataForKey, "UpdateSharedDataForKey", "sav", ""},
    MethodContract{Method::setDigestKey, "SetDigestKey", "ayi", ""},
};

// Whether the rows of a table, each with a field `method`, stand at the numbers of their methods, none left out.
template <typename Rows>
[[nodiscard]] constexpr bool standsInOrder(const Rows& rows) {
  for (size_t i = 0; i < rows.size(); ++i)
    if (static_cast<size_t>(rows[i].method) != i) return false;
  return rows.size() == static_cast<size_t>(Method::setDigestKey) + 1;
}
static_assert(standsInOrder(kMethods));

[[nodiscard]] constexpr const MethodContract& contractOf(Method method) {
  return kMethods[static_cast<size_t>(method)];
}

// The one call of the daemon on its client (ClientSessionReplyInterface), which is one way.
inline constexpr std::string_view kSendMessageToClient = "SendMessageToClient";
inline constexpr std::string_view kSendMessageToClientSignature = "aa{sv}dqqaa{sv}";

}  // namespace kyt::wire
