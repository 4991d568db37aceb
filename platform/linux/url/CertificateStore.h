// The certificates that servers are verified against, read once for all connections of the process: a store
// of its own for each connection would cost more memory and time than everything else about it. A certificate
// file is read again when it has changed; the system's folder is consulted by name, as needed. Network thread
// only.
#pragma once

#include <sys/stat.h>

#include <string>

struct x509_store_st;

namespace kyt {

class CertificateStore {
 public:
  // `file`: PEM; empty: the system's certificates.
  explicit CertificateStore(std::string file) : file_(std::move(file)) {}
  ~CertificateStore();
  CertificateStore(const CertificateStore&) = delete;
  CertificateStore& operator=(const CertificateStore&) = delete;

  // For a connection's TLS settings, which take a reference; null when there is no readable certificate.
  [[nodiscard]] x509_store_st* store();

 private:
  [[nodiscard]] bool load();
  std::string file_;
  struct stat read_ {};  // the file as it was when it was read
  x509_store_st* store_ = nullptr;
};

}  // namespace kyt
