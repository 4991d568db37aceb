// The upload of a client's log data: one HTTP request, whose answer says where it can be found.
#include "backends/dashboard/DashboardBackend.h"
#include "platform/Platform.h"
#include "platform/base/Counters.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/KeyedArchive.h"
#include "platform/queues/Log.h"

namespace kyt {

bool DashboardBackend::uploadLogData(const Value& logData) {
  if (!postURL_) {
    platform().log.error("DashboardBackend(uploadLogData): Post URL for log data array is nil");
    return false;
  }
  std::optional<Data> body = archivedData(logData);
  if (!body) {
    platform().log.error("DashboardBackend(uploadLogData): Failed to serialize log data array for upload");
    return false;
  }
  URLRequest request;
  request.method = "POST";
  request.url = postURL_->str();
  request.headers = {{"Content-Type", "application/octet-stream"}};
  request.body = std::move(*body);
  request.account = userAccount();
  const std::string address = request.url;
  const size_t bytes = request.body.size();
  const auto poster = connectivityDelegate();
  // Deliberately a success: the session is ending, and its client is not told that something is wrong.
  if (poster == nullptr) {
    platform().counters.add(Reason::postWithoutPoster);
    return true;
  }

  const URLReply reply = startAndWait(std::move(request), [&](URLRequest sent, URLCompletion completion) {
    poster->postURLRequestWithCompletionHandler(std::move(sent), std::move(completion));
  });
  tellOwner(DepartureKind::logData, address, bytes, reply);
  return finishUpload(reply.data, reply.error);
}

// The status is deliberately not looked at: any body is taken for the location.
bool DashboardBackend::finishUpload(const std::optional<Data>& reply, const std::optional<Error>& error) {
  if (error || !reply) {
    platform().counters.add(Reason::postFailed);
    platform().log.error("DashboardBackend(uploadLogData): Error uploading log data array (%s)",
                         error ? error->localizedDescription.c_str() : "(null)");
    return false;
  }
  // What is no text is no location, but taken all the same.
  const Value location = isValidUTF8(reply->view()) ? Value(String(reply->view())) : Value();
  platform().log.normal("DashboardBackend(uploadLogData): Log data uploaded to %s",
                        description(location).c_str());
  // Numbered like every event, but not sent: it ends in the base's operation that does nothing.
  takeEvent(true, {0, 2});
  sendMessage({{"LogDataUploadLocation", location}}, platform().clock.timeOfDay(), 0, 2, MessageFlag{0});
  return true;
}

}  // namespace kyt
