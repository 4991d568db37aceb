#include "backends/upload/UploadBackend.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cinttypes>
#include <cstdio>
#include <utility>
#include <variant>

#include "backend/PayloadCompression.h"
#include "platform/FileExtension.h"
#include "platform/Platform.h"
#include "platform/base/Blocking.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/Description.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

constexpr char kDescription[] = "Vidcall AFRC log";

// What follows a host: nothing, or a colon and a port.
bool isPort(std::string_view text) {
  if (text.empty()) return true;
  if (text.front() != ':') return false;
  text.remove_prefix(1);
  uint16_t port = 0;
  const char* const end = text.data() + text.size();
  const auto [stopped, error] = std::from_chars(text.data(), end, port);
  return text.empty() || (error == std::errc() && stopped == end);
}

bool hasBracket(std::string_view text) {
  return text.find_first_of("[]") != text.npos;
}

bool isHostAndPort(std::string_view authority) {
  if (const size_t user = authority.rfind('@'); user != authority.npos) {
    if (hasBracket(authority.substr(0, user))) return false;
    authority.remove_prefix(user + 1);
  }
  if (authority.starts_with('[')) {
    const size_t end = authority.find(']');
    return end != authority.npos && end > 1 && !hasBracket(authority.substr(1, end - 1)) &&
           isPort(authority.substr(end + 1));
  }
  const size_t end = std::min(authority.find(':'), authority.size());
  return end > 0 && !hasBracket(authority) && isPort(authority.substr(end));
}

bool mayStandInAddress(unsigned char c) {
  constexpr std::string_view marks = "-._~:/?#[]@!$&'()*+,;=%";
  return c < 0x80 && (std::isalnum(c) != 0 || marks.find(static_cast<char>(c)) != marks.npos);
}

// A URL as RFC 3986 has it: a scheme, a host, perhaps a port, and nothing that cannot stand where it stands.
bool isAddress(std::string_view url) {
  const size_t scheme = url.find("://");
  if (scheme == url.npos) return false;
  std::string name(url.substr(0, scheme));
  for (char& c : name) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  if (name != "https" && name != "http") return false;
  for (size_t i = 0; i < url.size(); ++i) {
    const auto c = static_cast<unsigned char>(url[i]);
    if (!mayStandInAddress(c)) return false;
    const bool escapes = c == '%';
    if (escapes && (i + 2 >= url.size() || std::isxdigit(static_cast<unsigned char>(url[i + 1])) == 0 ||
                    std::isxdigit(static_cast<unsigned char>(url[i + 2])) == 0))
      return false;
  }
  const std::string_view rest = url.substr(scheme + 3);
  const size_t host = std::min(rest.find_first_of("/?#"), rest.size());
  const bool hasOneFragment = rest.find('#') == rest.rfind('#');
  return isHostAndPort(rest.substr(0, host)) && !hasBracket(rest.substr(host)) && hasOneFragment;
}

}  // namespace

std::string percentEncodedForQuery(std::string_view text) {
  constexpr std::string_view allowed = "-._~!$&'()*+,;=:@/?";
  constexpr char digits[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    const bool plain = byte < 0x80 && (std::isalnum(byte) != 0 || allowed.find(c) != allowed.npos);
    if (plain) {
      out += c;
      continue;
    }
    out += '%';
    out += digits[byte >> 4];
    out += digits[byte & 15];
  }
  return out;
}

std::string_view lastPathComponent(std::string_view path) {
  while (path.size() > 1 && path.ends_with('/')) path.remove_suffix(1);
  const size_t slash = path.rfind('/');
  return slash == path.npos || path.size() == 1 ? path : path.substr(slash + 1);
}

std::shared_ptr<UploadBackend> UploadBackend::initWithName(Configuration& configuration, String name,
                                                           Dictionary profile, SharedSessionFacts facts) {
  const String* postURL = profile.string("post_url");
  if (postURL == nullptr) {
    configuration.platform.log.error("UploadBackend(initWithName): can't resolve upload post URL.");
    return nullptr;
  }
  String uploadURL = *postURL;
  return std::make_shared<UploadBackend>(Making(), configuration.platform, std::move(name),
                                         std::move(profile), std::move(facts), std::move(uploadURL));
}

UploadBackend::UploadBackend(Making making, Platform& platform, String name, Dictionary profile,
                             SharedSessionFacts facts, String uploadURL)
    : KYTReportingBackend(making, platform, std::move(name), std::move(profile), std::move(facts)),
      uploadURL_(std::move(uploadURL)) {
  if (const String* text = this->profile().string("display_url")) setDisplayURL(*text);
}

bool UploadBackend::uploadFileAtPath(const String& path, const String& extensionToken, FileOffer& offer) {
  Log& log = platform().log;
  log.normal("UploadBackend(uploadFileAtPath): Uploading file %s", path.c_str());
  if (!uploadURL_) return false;
  const std::unique_ptr<FileAccess> file = platform().fileExtensions.consume(extensionToken, offer.take());
  if (file == nullptr || !file->isReadableRegularFile()) {
    log.error("UploadBackend(uploadFileAtPath): Only upload a regular file.");
    return false;
  }
  std::optional<Data> body = compressedFile(*file);
  if (!body) return false;
  const std::string_view name = lastPathComponent(path);
  std::optional<URLRequest> request = newRequest(name, std::move(*body));
  if (!request) {
    log.error("UploadBackend(uploadFileAtPath): Unable to create URL request");
    return false;
  }
  const auto poster = connectivityDelegate();
  // Deliberately still true: the client's file was taken, and stays where it is.
  if (poster == nullptr) {
    platform().counters.add(Reason::postWithoutPoster);
    return true;
  }
  // A failed removal is no failure of the upload; whoever removes files counts it.
  if (post(*poster, std::move(*request))) static_cast<void>(file->remove(name));
  return true;
}

std::optional<Data> UploadBackend::compressedFile(FileAccess& file) {
  Log& log = platform().log;
  const uint64_t most = platform().limits.maxUploadBytes;
  std::variant<Data, FileReadError> read = file.readWhole(most);
  const FileReadError* error = std::get_if<FileReadError>(&read);
  if (error != nullptr && *error == FileReadError::tooLarge) {
    if (platform().counters.addAndMayLog(Reason::uploadTooLarge, platform().clock.monotonic()))
      log.error("UploadBackend(uploadFileAtPath): Input file is over the limit of %" PRIu64 " bytes", most);
    return std::nullopt;
  }
  if (error != nullptr && *error == FileReadError::tooMuchAtOnce) {
    if (platform().counters.addAndMayLog(Reason::tooMuchUploadedAtOnce, platform().clock.monotonic()))
      log.error(
          "UploadBackend(uploadFileAtPath): Input file refused, too much of its user is being uploaded");
    return std::nullopt;
  }
  // One that could not be read counts as empty.
  const Data* contents = std::get_if<Data>(&read);
  if (contents == nullptr || contents->empty()) {
    log.error("UploadBackend(uploadFileAtPath): Input file is empty");
    return std::nullopt;
  }
  std::optional<Data> body;
  {
    // A large file takes seconds: as long as a wait, and no reason for other sessions to stand in line.
    const BlockingScope blocking;
    body = gzipDeflate(platform(), contents->bytes());
  }
  file.holdsOnly(body ? body->size() : 0);
  return body;
}

std::optional<URLRequest> UploadBackend::newRequest(std::string_view fileName, Data body) const {
  URLRequest request;
  request.method = "POST";
  const std::string compressedName = std::string(fileName) + ".gz";
  request.url = formatObjects(
      "%@?uuid=%s&sequence=%u&description=%@%%20(Uploaded%%20by%%20TQS)&filename=%@&raw=true",
      {*uploadURL_, facts().udid.value_or(String()), facts().sessionID,
       String(percentEncodedForQuery(kDescription)), String(percentEncodedForQuery(compressedName))});
  // The whole of it: what "post_url" says may become an address, or stop being one, by what follows it.
  if (!isAddress(request.url)) return std::nullopt;
  request.headers = {{"Content-Type", "application/octet-stream"}, {"Content-Encoding", "gzip"}};
  request.body = std::move(body);
  return request;
}

bool UploadBackend::post(ReportingSessionConnectivityInterface& poster, URLRequest request) {
  const std::string address = request.url;
  const size_t bytes = request.body.size();
  const URLReply reply = startAndWait(std::move(request), [&](URLRequest sent, URLCompletion completion) {
    poster.postURLRequestWithCompletionHandler(std::move(sent), std::move(completion));
  });
  tellOwner(DepartureKind::file, address, bytes, reply);
  Log& log = platform().log;
  if (!reply.data) {
    platform().counters.add(Reason::postFailed);
    log.error("UploadBackend(uploadFileAtPath): post %s",
              reply.error ? reply.error->localizedDescription.c_str() : "(null)");
    return false;
  }
  // The status is deliberately not looked at: servers of this kind say in the text whether they have the file.
  const bool readable = isValidUTF8(reply.data->view());
  const std::string text(readable ? reply.data->view() : "(null)");
  log.normal("UploadBackend(uploadFileAtPath): sending to |%s|, Json output: %s", uploadURL_->c_str(),
             text.c_str());
  return readable && text.find("success") != std::string::npos;
}

}  // namespace kyt
