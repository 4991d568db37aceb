#include <curl/curl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>

#include "tests/linux/url/CurlUrlSessionFixture.h"

namespace kyt {
namespace {

class CurlURLSessionTLS : public CurlURLSessionFixture {
 protected:
  CurlURLSessionTLS() { options_.certificateFile = authority_.file(); }
  static TestHTTPServer::Options with(TestCertificate certificate, int maximumTLSVersion = 0) {
    TestHTTPServer::Options options;
    options.certificate = std::move(certificate);
    options.maximumTLSVersion = maximumTLSVersion;
    return options;
  }
  TestCertificateAuthority authority_;
};

TEST_F(CurlURLSessionTLS, TrustsWhatTheAuthoritySigned) {
  TestHTTPServer server(with(authority_.issue()));
  auto urls = session();
  for (int i = 0; i < 3; ++i) EXPECT_EQ(perform(*urls, post(server.url("/"), "secret")).status(), 200);
  EXPECT_EQ(server.requests()[0].tlsVersion, "TLSv1.3");
  EXPECT_EQ(server.requests()[0].body, "secret");
  EXPECT_EQ(server.connectionsAccepted(), 1u);
}

TEST_F(CurlURLSessionTLS, SpeaksTLS12) {
  TestHTTPServer server(with(authority_.issue(), 0x0303));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).status(), 200);
  EXPECT_EQ(server.requests()[0].tlsVersion, "TLSv1.2");
}

TEST_F(CurlURLSessionTLS, RefusesTLS11) {
  TestHTTPServer server(with(authority_.issue(), 0x0302));
  auto urls = session(true);
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_SSL_CONNECT_ERROR);
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(CurlURLSessionTLS, RefusesACertificateThatNobodyTrustedSigned) {
  TestCertificateAuthority stranger;
  TestHTTPServer server(with(stranger.issue()));
  auto urls = session();
  const Outcome outcome = perform(*urls, post(server.url("/"), "secret"));
  EXPECT_EQ(outcome.errorCode(), CURLE_PEER_FAILED_VERIFICATION);
  EXPECT_NE(outcome.errorText().find("certificate"), std::string::npos);
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(CurlURLSessionTLS, RefusesATestAuthorityByTheSystemsCertificates) {
  options_.certificateFile.clear();
  TestHTTPServer server(with(authority_.issue()));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_PEER_FAILED_VERIFICATION);
}

TEST_F(CurlURLSessionTLS, RefusesACertificateForAnotherName) {
  TestHTTPServer server(with(authority_.issue({"elsewhere.example"})));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_PEER_FAILED_VERIFICATION);
}

TEST_F(CurlURLSessionTLS, RefusesAnExpiredCertificate) {
  TestHTTPServer server(with(authority_.issue({"localhost", "127.0.0.1"}, true)));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_PEER_FAILED_VERIFICATION);
}

TEST_F(CurlURLSessionTLS, RefusesEverythingWithoutItsCertificateFile) {
  options_.certificateFile = authority_.folder() + "/missing.pem";
  TestHTTPServer server(with(authority_.issue()));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_SSL_CACERT_BADFILE);
  EXPECT_EQ(server.requestCount(), 0u);
}

TEST_F(CurlURLSessionTLS, TakesUpAReplacedCertificateFile) {
  TestCertificateAuthority next;
  TestHTTPServer server(with(next.issue()));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_PEER_FAILED_VERIFICATION);
  std::filesystem::copy_file(next.file(), authority_.folder() + "/next.pem");
  std::filesystem::rename(authority_.folder() + "/next.pem", authority_.file());
  const Outcome outcome = perform(*urls, get(server.url("/")));
  EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
}

TEST_F(CurlURLSessionTLS, FollowsFiveRedirectsThatStayOnHTTPSButNotASixth) {
  TestHTTPServer server(with(authority_.issue()));
  server.setHandler([&](const TestHTTPServer::Request& request) {
    const int left = std::stoi(request.target.substr(1));
    TestHTTPServer::Reply reply;
    if (left > 0) {
      reply.status = 302;
      reply.headers = {{"Location", server.url("/" + std::to_string(left - 1))}, {"X-On-The-Way", "1"}};
      reply.body = "elsewhere";
    } else {
      reply.headers = {{"X-There", "1"}};
      reply.body = "arrived";
    }
    return reply;
  });
  auto urls = session();
  URLRequest request = get(server.url("/5"));
  request.maxRedirects = 5;
  request.headers = {{"If-Modified-Since", "then"}};
  const Outcome outcome = perform(*urls, request);
  EXPECT_EQ(outcome.status(), 200);
  EXPECT_EQ(outcome.body(), "arrived");
  EXPECT_EQ(outcome.response()->header("X-There"), "1");
  EXPECT_FALSE(outcome.response()->header("X-On-The-Way"));
  EXPECT_EQ(server.requestCount(), 6u);
  request.url = server.url("/6");
  EXPECT_EQ(perform(*urls, request).errorCode(), CURLE_TOO_MANY_REDIRECTS);
}

TEST_F(CurlURLSessionTLS, RefusesARedirectThatLeavesHTTPS) {
  TestHTTPServer plain, server(with(authority_.issue()));
  server.setReply({.status = 301, .headers = {{"Location", plain.url("/")}}});
  auto urls = session();
  URLRequest request = get(server.url("/"));
  request.maxRedirects = 5;
  EXPECT_EQ(perform(*urls, request).errorCode(), CURLE_UNSUPPORTED_PROTOCOL);
  EXPECT_EQ(plain.requestCount(), 0u);
}

// nginx as a child process that ends with this object. Its listening socket is made here and handed over, so
// that no port is guessed. It answers for a second server of its own, through a socket in the folder, since a
// proxy reads a request's body before it passes it on: nginx answers by itself before it has read the body,
// which ends the stream under the client that still sends.
class Nginx {
 public:
  Nginx(const std::string& folder, const TestCertificate& certificate) {
    std::ofstream(folder + "/server.pem") << certificate.certificatePEM << certificate.keyPEM;
    const int listening = listenOnAFreePort();
    const std::string file = folder + "/nginx.conf";
    std::ofstream(file) << configuration(folder);
    const std::string inherited = std::to_string(listening) + ";", errors = folder + "/error.log";
    pid_ = fork();
    if (pid_ == 0) {
      setenv("NGINX", inherited.c_str(), 1);
      execl("/usr/sbin/nginx", "nginx", "-c", file.c_str(), "-p", folder.c_str(), "-e", errors.c_str(),
            nullptr);
      _exit(127);
    }
    close(listening);
  }
  ~Nginx() {
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
  }
  Nginx(const Nginx&) = delete;
  Nginx& operator=(const Nginx&) = delete;

  [[nodiscard]] std::string url() const { return "https://127.0.0.1:" + std::to_string(port_) + "/"; }

 private:
  [[nodiscard]] std::string configuration(const std::string& folder) const {
    // With a socket handed over nginx needs its master process; its worker would leave root otherwise.
    std::ostringstream text;
    text << (geteuid() == 0 ? "user root;\n" : "") << "daemon off;\nworker_processes 1;\npid " << folder
         << "/pid;\nerror_log " << folder << "/error.log;\nevents {}\nhttp {\naccess_log off;\n";
    for (const char* kind : {"client_body", "proxy", "fastcgi", "uwsgi", "scgi"})
      text << kind << "_temp_path " << folder << "/" << kind << ";\n";
    text
        << "server {\nlisten 127.0.0.1:" << port_ << " ssl http2;\nssl_certificate " << folder
        << "/server.pem;\nssl_certificate_key " << folder
        << "/server.pem;\nlocation / {\nproxy_pass http://unix:" << folder
        << "/socket;\nproxy_pass_request_body off;\nproxy_set_header Content-Length \"\";\n"
           "proxy_set_header X-Protocol $server_protocol;\nproxy_set_header X-Connection $connection;\n}\n}\n"
           "server {\nlisten unix:"
        << folder
        << "/socket;\nlocation / { add_header Last-Modified then always; "
           "return 200 \"$http_x_protocol $http_x_connection $http_x_kyt_source_application\"; }\n}\n}\n";
    return text.str();
  }
  int listenOnAFreePort() {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    const int made = socket(AF_INET, SOCK_STREAM, 0);
    EXPECT_EQ(bind(made, reinterpret_cast<sockaddr*>(&address), size), 0);
    EXPECT_EQ(listen(made, 64), 0);
    EXPECT_EQ(getsockname(made, reinterpret_cast<sockaddr*>(&address), &size), 0);
    port_ = ntohs(address.sin_port);
    return made;
  }
  uint16_t port_ = 0;
  pid_t pid_ = -1;
};

TEST_F(CurlURLSessionTLS, SpeaksHTTP2WithARealServerAndSharesOneConnectionInABurst) {
  if (access("/usr/sbin/nginx", X_OK) != 0) GTEST_SKIP() << "nginx is not installed";
  const Nginx nginx(authority_.folder(), authority_.issue());
  auto urls = session();
  std::vector<Outcome> outcomes(30);
  for (Outcome& outcome : outcomes)
    urls->start(post(nginx.url(), std::string(8192, 'x')), outcome.completion());
  std::set<std::string> bodies;
  for (Outcome& outcome : outcomes) {
    ASSERT_TRUE(outcome.wait());
    EXPECT_EQ(outcome.status(), 200) << outcome.errorText();
    EXPECT_EQ(outcome.response()->header("Last-Modified"), "then");
    bodies.insert(outcome.body());
  }
  ASSERT_EQ(bodies.size(), 1u);  // the same connection's number in each
  EXPECT_TRUE(bodies.begin()->starts_with("HTTP/2.0 ")) << *bodies.begin();
  EXPECT_TRUE(bodies.begin()->ends_with(" com.vantu.system.diagnostics"));
}

}  // namespace
}  // namespace kyt
