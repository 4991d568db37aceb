#include "tests/devserver/ServerProcess.h"

#include <arpa/inet.h>
#include <curl/curl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>

#include "tests/support/ReadFile.h"

namespace kyt::devserver::test {
namespace {

using std::chrono::steady_clock;

size_t appendTo(char* bytes, size_t size, size_t count, void* into) {
  static_cast<std::string*>(into)->append(bytes, size * count);
  return size * count;
}

int millisecondsUntil(steady_clock::time_point deadline) {
  const auto left =
      std::chrono::duration_cast<std::chrono::milliseconds>(deadline - steady_clock::now()).count();
  return static_cast<int>(std::max<long>(left, 0));
}

// Reads until a line is complete, the end, or the deadline.
std::string readLine(int descriptor, steady_clock::time_point deadline) {
  std::string line;
  pollfd waiting{descriptor, POLLIN, 0};
  char byte = 0;
  while (poll(&waiting, 1, millisecondsUntil(deadline)) > 0 && read(descriptor, &byte, 1) == 1 &&
         byte != '\n') {
    line += byte;
  }
  return line;
}

std::map<std::string, std::string> headersFrom(const std::string& text) {
  std::map<std::string, std::string> headers;
  size_t begin = 0;
  while (begin < text.size()) {
    const size_t end = std::min(text.find("\r\n", begin), text.size());
    const std::string line = text.substr(begin, end - begin);
    const size_t colon = line.find(": ");
    if (colon != std::string::npos) {
      std::string name = line.substr(0, colon);
      std::transform(name.begin(), name.end(), name.begin(), [](unsigned char c) { return std::tolower(c); });
      headers[name] = line.substr(colon + 2);
    }
    begin = end + 2;
  }
  return headers;
}

}  // namespace

TemporaryFolder::TemporaryFolder() {
  std::string pattern = std::filesystem::temp_directory_path() / "kytdevserver-test-XXXXXX";
  path_ = mkdtemp(pattern.data());
}

TemporaryFolder::~TemporaryFolder() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

void TemporaryFolder::write(const std::string& name, std::string_view content) const {
  std::ofstream(path_ / name, std::ios::binary | std::ios::trunc) << content;
}

std::string TemporaryFolder::read(const std::string& name) const {
  return readFile(path_ / name);
}

std::string Response::header(const std::string& name) const {
  const auto found = headers.find(name);
  return found == headers.end() ? std::string() : found->second;
}

rapidjson::Document Response::json() const {
  rapidjson::Document document;
  document.Parse<rapidjson::kParseFullPrecisionFlag | rapidjson::kParseValidateEncodingFlag>(body.data(),
                                                                                             body.size());
  return document;
}

ServerProcess::ServerProcess(const std::filesystem::path& state, std::vector<std::string> options,
                             uint16_t httpPort)
    : state_(state) {
  std::vector<std::string> words = {KYT_DEVSERVER, "--state",     state.string(),          "--https-port",
                                    "0",           "--http-port", std::to_string(httpPort)};
  words.insert(words.end(), options.begin(), options.end());
  std::vector<char*> arguments;
  for (std::string& word : words) arguments.push_back(word.data());
  arguments.push_back(nullptr);
  errorsFile_ = memfd_create("errors", MFD_CLOEXEC);
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) return;
  pid_ = fork();
  if (pid_ == 0) {
    dup2(ends[1], STDOUT_FILENO);
    dup2(errorsFile_, STDERR_FILENO);
    execv(KYT_DEVSERVER, arguments.data());
    _exit(127);
  }
  close(ends[1]);
  output_ = ends[0];
  rapidjson::Document ready;
  ready.Parse(readLine(output_, steady_clock::now() + std::chrono::seconds(60)).c_str());
  if (ready.HasParseError() || !ready.IsObject()) {
    stop();
    return;
  }
  httpsPort_ = static_cast<uint16_t>(ready["https"].GetUint());
  httpPort_ = static_cast<uint16_t>(ready["http"].GetUint());
  if (ready.HasMember("udp")) udpPort_ = static_cast<uint16_t>(ready["udp"].GetUint());
}

ServerProcess::~ServerProcess() {
  stop();
}

int ServerProcess::stop() {
  if (pid_ < 0) return status_;
  kill(pid_, SIGTERM);
  // The pipe ends with the process.
  const auto deadline = steady_clock::now() + std::chrono::seconds(30);
  while (!readLine(output_, deadline).empty()) {
  }
  const bool late = steady_clock::now() >= deadline;
  if (late) kill(pid_, SIGKILL);
  int status = 0;
  waitpid(pid_, &status, 0);
  status_ = !late && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  pid_ = -1;
  close(output_);
  char block[4096];
  lseek(errorsFile_, 0, SEEK_SET);
  for (ssize_t count = 0; (count = read(errorsFile_, block, sizeof block)) > 0;) {
    errors_.append(block, static_cast<size_t>(count));
  }
  close(errorsFile_);
  return status_;
}

Response perform(const std::string& url, const Call& call) {
  Response response;
  std::string headerText;
  const std::unique_ptr<CURL, void (*)(CURL*)> curl(curl_easy_init(), curl_easy_cleanup);
  curl_slist* list = nullptr;
  for (const std::string& header : call.headers) list = curl_slist_append(list, header.c_str());
  const std::unique_ptr<curl_slist, void (*)(curl_slist*)> headers(list, curl_slist_free_all);
  curl_easy_setopt(curl.get(), CURLOPT_URL, url.c_str());
  curl_easy_setopt(curl.get(), CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(curl.get(), CURLOPT_NOPROXY, "*");
  curl_easy_setopt(curl.get(), CURLOPT_CUSTOMREQUEST, call.method.c_str());
  curl_easy_setopt(curl.get(), CURLOPT_PATH_AS_IS, 1L);
  curl_easy_setopt(curl.get(), CURLOPT_TIMEOUT_MS, static_cast<long>(call.timeout.count()));
  curl_easy_setopt(curl.get(), CURLOPT_WRITEFUNCTION, appendTo);
  curl_easy_setopt(curl.get(), CURLOPT_WRITEDATA, &response.body);
  curl_easy_setopt(curl.get(), CURLOPT_HEADERFUNCTION, appendTo);
  curl_easy_setopt(curl.get(), CURLOPT_HEADERDATA, &headerText);
  curl_easy_setopt(curl.get(), CURLOPT_HTTPHEADER, list);
  if (!call.ca.empty()) curl_easy_setopt(curl.get(), CURLOPT_CAINFO, call.ca.c_str());
  if (call.tlsAtMost != 0) curl_easy_setopt(curl.get(), CURLOPT_SSLVERSION, call.tlsAtMost);
  if (!call.body.empty() || call.method == "POST") {
    curl_easy_setopt(curl.get(), CURLOPT_POSTFIELDS, call.body.data());
    curl_easy_setopt(curl.get(), CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(call.body.size()));
  }
  response.error = curl_easy_perform(curl.get());
  curl_easy_getinfo(curl.get(), CURLINFO_RESPONSE_CODE, &response.status);
  response.headers = headersFrom(headerText);
  return response;
}

Response ServerProcess::https(const std::string& path, const Call& call) const {
  Call verified = call;
  if (verified.ca.empty()) verified.ca = caFile();
  return perform("https://localhost:" + std::to_string(httpsPort_) + path, verified);
}

Response ServerProcess::http(const std::string& path, const Call& call) const {
  return perform("http://127.0.0.1:" + std::to_string(httpPort_) + path, call);
}

Response ServerProcess::post(const std::string& path, const std::string& body,
                             std::vector<std::string> headers) const {
  Call call;
  call.method = "POST";
  call.body = body;
  call.headers = std::move(headers);
  return https(path, call);
}

rapidjson::Document ServerProcess::get(const std::string& path) const {
  return http(path).json();
}

Connection::Connection(uint16_t port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  descriptor_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(descriptor_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) close();
}

Connection::~Connection() {
  close();
}

void Connection::close() {
  if (descriptor_ >= 0) ::close(descriptor_);
  descriptor_ = -1;
}

void Connection::send(std::string_view bytes) const {
  while (!bytes.empty()) {
    const ssize_t count = ::send(descriptor_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (count <= 0) return;
    bytes.remove_prefix(static_cast<size_t>(count));
  }
}

std::string Connection::receiveUntil(std::string_view text, std::chrono::milliseconds timeout) {
  const auto deadline = steady_clock::now() + timeout;
  pollfd waiting{descriptor_, POLLIN, 0};
  char block[4096];
  while (received_.find(text) == std::string::npos && poll(&waiting, 1, millisecondsUntil(deadline)) > 0) {
    const ssize_t count = recv(descriptor_, block, sizeof block, 0);
    closed_ = count <= 0;
    if (closed_) break;
    received_.append(block, static_cast<size_t>(count));
  }
  return received_;
}

std::string gzip(std::string_view text) {
  z_stream stream{};
  deflateInit2(&stream, Z_BEST_SPEED, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY);
  std::string out(deflateBound(&stream, text.size()), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  deflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  deflateEnd(&stream);
  return out;
}

std::string message(const std::string& events) {
  return R"({"postTime":1769860800.25,"clientId":"device","events":[)" + events + "]}";
}

}  // namespace kyt::devserver::test
