// The certificates that servers are verified against, read once for all connections of the process: a store
// of its own for each connection would cost more memory and time than everything else about it. They are read again when
// the certificate file has changed, or the system's file or one of its folders, so that an authority that an
// administrator withdrew is not trusted any more. Network thread only; it never waits for what a file's name leads to
// (a pipe), and keeps what was read before while a file cannot be read. A file that could be read and holds something
// broken is not read again before it changes.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

struct x509_store_st;

namespace kyt {

class CertificateStore {
 public:
  // `file`: PEM; empty: the system's certificates.
  explicit CertificateStore(std::string file);
  ~CertificateStore();
  CertificateStore(const CertificateStore&) = delete;
  CertificateStore& operator=(const CertificateStore&) = delete;

  // From now on another file, or the system's. What was read before holds until that one can be read.
  void setFile(std::string file);
  // For a connection's TLS settings, which take a reference; null when there is no readable certificate.
  [[nodiscard]] x509_store_st* store();
  // Another number each time that they have been read.
  [[nodiscard]] unsigned generation();

 private:
  // What tells one state of a file or folder from another; zeros where there is none.
  struct Seen {
    uint64_t device = 0, inode = 0;
    int64_t size = 0, changedSeconds = 0, changedNanoseconds = 0;
    friend bool operator==(const Seen&, const Seen&) = default;
  };
  [[nodiscard]] static Seen look(const std::string& path);
  void load();

  std::string file_;
  std::vector<std::string> watched_;  // the file, or the system's file and folders
  std::vector<Seen> read_;            // as they were when they were read
  x509_store_st* store_ = nullptr;
  unsigned generation_ = 0;
};

}  // namespace kyt
