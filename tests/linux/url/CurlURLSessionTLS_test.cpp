#include <curl/curl.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <set>

#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/linux/url/Http2Nginx.h"

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

// How often the file has been opened since this was made.
class Openings {
 public:
  explicit Openings(const std::string& file) : events_(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
    EXPECT_GE(::inotify_add_watch(events_, file.c_str(), IN_OPEN | IN_CLOSE), 0);
  }
  ~Openings() { ::close(events_); }
  Openings(const Openings&) = delete;
  Openings& operator=(const Openings&) = delete;
  int count() {
    inotify_event event;  // without a name, since a file is watched
    while (::read(events_, &event, sizeof event) > 0) count_ += (event.mask & IN_OPEN) != 0 ? 1 : 0;
    return count_;
  }

 private:
  const int events_;
  int count_ = 0;
};

// The thread that reads it carries all requests.
TEST_F(CurlURLSessionTLS, ABrokenCertificateFileIsReadOnceAndAgainWhenItHasChanged) {
  TestHTTPServer server(with(authority_.issue()));
  std::ifstream in(authority_.file());
  const std::string good((std::istreambuf_iterator<char>(in)), {});
  const auto write = [&](const std::string& text) { std::ofstream(authority_.file()) << text; };
  const std::string broken = good + "-----BEGIN CERTIFICATE-----\nnonsense\n-----END CERTIFICATE-----\n";
  write(broken);
  Openings openings(authority_.file());
  for (int i = 0; i < 5; ++i)
    EXPECT_EQ(perform(*session(), get(server.url("/"))).errorCode(), CURLE_SSL_CACERT_BADFILE);
  EXPECT_EQ(openings.count(), 1);
  write(good);
  EXPECT_EQ(perform(*session(), get(server.url("/"))).status(), 200);
  const int before = openings.count();
  write(broken);
  for (int i = 0; i < 5; ++i) EXPECT_EQ(perform(*session(), get(server.url("/"))).status(), 200);
  EXPECT_EQ(openings.count(), before + 2) << "one of them to write it";
}

// What is refused once may be granted the next time.
TEST_F(CurlURLSessionTLS, ACertificateFileThatCouldNotBeReadIsTriedAgain) {
  TestHTTPServer server(with(authority_.issue()));
  const std::string away = authority_.folder() + "/away.pem";
  std::filesystem::rename(authority_.file(), away);
  std::filesystem::create_directory(authority_.file());
  EXPECT_EQ(perform(*session(), get(server.url("/"))).errorCode(), CURLE_SSL_CACERT_BADFILE);
  std::filesystem::remove(authority_.file());
  std::filesystem::rename(away, authority_.file());
  EXPECT_EQ(perform(*session(), get(server.url("/"))).status(), 200);
}

TEST_F(CurlURLSessionTLS, ANamedPipeInTheCertificateFilesPlaceHoldsNobody) {
  const std::string pipe = authority_.folder() + "/pipe.pem";
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0600), 0);
  options_.certificateFile = pipe;
  TestHTTPServer server(with(authority_.issue()));
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_SSL_CACERT_BADFILE);
}

// As `openssl rehash` names it: the hash of its subject.
std::string hashedName(const std::string& file) {
  const std::unique_ptr<FILE, int (*)(FILE*)> in(std::fopen(file.c_str(), "r"), std::fclose);
  X509* certificate = PEM_read_X509(in.get(), nullptr, nullptr, nullptr);
  char name[16];
  std::snprintf(name, sizeof name, "%08lx.0", X509_subject_name_hash(certificate));
  X509_free(certificate);
  return name;
}

TEST_F(CurlURLSessionTLS, AnAuthorityThatTheSystemWithdrewIsNotTrustedAnyMore) {
  const std::string folder = authority_.folder() + "/system";
  std::filesystem::create_directory(folder);
  const std::string file = folder + "/" + hashedName(authority_.file());
  std::filesystem::copy_file(authority_.file(), file);
  ::setenv("SSL_CERT_DIR", (authority_.folder() + "/none:" + folder).c_str(), 1);
  options_.certificateFile.clear();
  TestHTTPServer server(with(authority_.issue()));
  server.setHandler([](const TestHTTPServer::Request&) {
    TestHTTPServer::Reply reply;
    reply.headers = {{"Connection", "close"}};
    return reply;
  });
  auto urls = session();
  EXPECT_EQ(perform(*urls, get(server.url("/"))).status(), 200);
  std::filesystem::remove(file);
  EXPECT_EQ(perform(*urls, get(server.url("/"))).errorCode(), CURLE_PEER_FAILED_VERIFICATION);
  std::filesystem::copy_file(authority_.file(), file);
  EXPECT_EQ(perform(*urls, get(server.url("/"))).status(), 200);
  ::unsetenv("SSL_CERT_DIR");
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

TEST_F(CurlURLSessionTLS, SpeaksHTTP2WithARealServerAndSharesOneConnectionInABurst) {
  if (!HTTP2Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
  const HTTP2Nginx nginx(authority_.folder(), authority_.issue());
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
