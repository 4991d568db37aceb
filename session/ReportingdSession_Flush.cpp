// What a client asks of all back ends at once: flush, a file's upload, log data. The session decides who is
// asked, how the answers combine and what is logged; what a back end does is its own affair.
#include <memory>
#include <utility>

#include "platform/Platform.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "session/FileURL.h"
#include "session/FlushFanIn.h"
#include "session/MessageLog.h"
#include "session/ReportingdSession.h"

namespace kyt {

namespace {

// A client's text of any length must not fill the message log for all others: no URL of a file is longer.
String shownURL(const String& url) {
  constexpr size_t kLongest = 3 * 4096;
  // Escaping makes no text shorter, so what is past this and a character more would be cut away.
  const std::string shown = escapedText(url.view().substr(0, kLongest + 4));
  if (shown.size() <= kLongest) return shown;
  size_t end = kLongest;
  while ((static_cast<unsigned char>(shown[end]) & 0xC0) == 0x80) --end;
  return shown.substr(0, end) + " (cut)";
}

}  // namespace

void ReportingdSession::flushMessagesWithCompletion(ResultReply completion) {
  log().debug("flushMessagesWithCompletion: Flushing messages for session %u", _sessionID);
  internalFlushMessagesWithCompletion(std::move(completion));
}

void ReportingdSession::internalFlushMessagesWithCompletion(ResultReply completion) {
  if (!hasBackends()) {
    constexpr char text[] = "No backends available to send message";
    log().debug("internalFlushMessagesWithCompletion: %s", text);
    if (completion) completion(nullptr, Error{kKYTReportingErrorDomain, -1, text});
    return;
  }
  isAnswerAwaited_ = static_cast<bool>(completion);
  auto fanIn = std::make_shared<FlushFanIn>(class_, peerUser_, std::move(completion),
                                            static_cast<int32_t>(_backends.size()));
  for (const auto& [key, backend] : _backends) {
    // The operation's own result says nothing that the completion does not.
    static_cast<void>(backend->flushMessagesWithCompletion(
        [fanIn, key = key, name = backend->name()](Value result, std::optional<Error> error) {
          fanIn->backendFinished(key, name, std::move(result), std::move(error));
        }));
  }
  isAnswerAwaited_ = false;
  figuresMayHaveChanged();
}

void ReportingdSession::uploadFileAtPath(String fileURL, String extensionToken,
                                         std::optional<FileExtension> extension,
                                         SuccessReply completionHandler) {
  log().debug("uploadFileAtPath: Uploading file for session %u", _sessionID);
  uploadFileWithURL(fileURL, extensionToken, std::move(extension), std::move(completionHandler));
}

void ReportingdSession::uploadFileWithURL(const String& fileURL, const String& extensionToken,
                                          std::optional<FileExtension> extension,
                                          SuccessReply completionHandler) {
  const std::optional<String> path = pathOfFileURL(fileURL);
  FileOffer offer(std::move(extension));
  bool success = false;
  // A URL that names no file is asked of nobody.
  if (path) {
    for (const auto& [key, backend] : _backends)
      if (backend->uploadFileAtPath(*path, extensionToken, offer)) success = true;
  }
  const char* shownPath = path ? path->c_str() : "(null)";
  if (success)
    log().debug("uploadFileWithURL: File upload successful for %s", shownPath);
  else
    log().error("uploadFileWithURL: File upload failed for %s", shownPath);
  class_.messageLog().writeToLogFile(peerUser_, "[uploadFileWithURL] Upload %@ for file %@",
                                     {success ? "succeeded" : "failed", shownURL(fileURL)});
  if (completionHandler) completionHandler(success);
}

void ReportingdSession::uploadLogData(Value logData, SuccessErrorReply completionHandler) {
  bool success = false;
  for (const auto& [key, backend] : _backends)
    if (backend->uploadLogData(logData)) success = true;
  if (success)
    log().debug("uploadLogData: Log data array upload successful");
  else
    log().error("uploadLogData: Log data array upload failed");
  if (completionHandler) completionHandler(success, std::nullopt);
}

}  // namespace kyt
