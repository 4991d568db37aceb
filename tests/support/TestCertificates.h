// A throw-away certificate authority, made anew by each test program: it issues server certificates that are
// good for a day and writes its own certificate where a client can be told to look. Nothing outlives the
// test.
#pragma once

#include <memory>
#include <string>
#include <vector>

namespace kyt {

struct TestCertificate {
  std::string certificatePEM;
  std::string keyPEM;
};

class TestCertificateAuthority {
 public:
  TestCertificateAuthority();
  ~TestCertificateAuthority();  // removes its folder
  TestCertificateAuthority(const TestCertificateAuthority&) = delete;
  TestCertificateAuthority& operator=(const TestCertificateAuthority&) = delete;

  // The authority's own certificate, PEM, in a temporary folder.
  [[nodiscard]] const std::string& file() const { return file_; }
  [[nodiscard]] const std::string& folder() const { return folder_; }
  // Names are host names, or addresses when they consist of digits and dots only. Thread-safe: no; call it
  // from one.
  [[nodiscard]] TestCertificate issue(const std::vector<std::string>& names = {"localhost", "127.0.0.1"},
                                      bool expired = false);

 private:
  struct Keys;
  std::unique_ptr<Keys> keys_;
  std::string folder_, file_;
};

}  // namespace kyt
