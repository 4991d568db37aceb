#include "platform/linux/url/CertificateStore.h"

#include <fcntl.h>
#include <openssl/bio.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <memory>
#include <optional>
#include <string_view>
#include <utility>

#include "platform/linux/base/Descriptors.h"

namespace kyt {
namespace {

struct Free {
  void operator()(X509_STORE* store) const { X509_STORE_free(store); }
  void operator()(BIO* bio) const { BIO_free(bio); }
  void operator()(STACK_OF(X509_INFO) * entries) const { sk_X509_INFO_pop_free(entries, X509_INFO_free); }
};
using Store = std::unique_ptr<X509_STORE, Free>;

std::string fromEnvironment(const char* name, const char* otherwise) {
  const char* value = std::getenv(name);
  return value != nullptr ? value : otherwise;
}

std::vector<std::string> systemPlaces() {
  std::vector<std::string> places = {
      fromEnvironment(X509_get_default_cert_file_env(), X509_get_default_cert_file())};
  const std::string folders = fromEnvironment(X509_get_default_cert_dir_env(), X509_get_default_cert_dir());
  for (std::string_view rest = folders; !rest.empty();) {
    const size_t end = std::min(rest.find(':'), rest.size());
    places.emplace_back(rest.substr(0, end));
    rest.remove_prefix(std::min(end + 1, rest.size()));
  }
  return places;
}

// The whole of a file, or nothing when it cannot be read now.
std::optional<std::string> contentsOf(const std::string& path) {
  // Without O_NONBLOCK a named pipe in the file's place would hold the network thread for ever.
  const Descriptor file = ownDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (file.get() < 0) return std::nullopt;
  std::string contents;
  struct stat status = {};
  ssize_t count = ::fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode) ? 1 : -1;
  while (count > 0) {
    char bytes[16384];
    count = ::read(file.get(), bytes, sizeof bytes);
    if (count > 0) contents.append(bytes, static_cast<size_t>(count));
  }
  return count == 0 ? std::optional(std::move(contents)) : std::nullopt;
}

// All certificates and revocation lists of a PEM file; false when there is none, or one of them is broken.
bool addCertificates(X509_STORE* store, const std::string& contents) {
  const std::unique_ptr<BIO, Free> memory(
      BIO_new_mem_buf(contents.data(), static_cast<int>(std::min<size_t>(contents.size(), INT_MAX))));
  if (!memory) return false;
  const std::unique_ptr<STACK_OF(X509_INFO), Free> entries(
      PEM_X509_INFO_read_bio(memory.get(), nullptr, nullptr, nullptr));
  if (!entries) return false;
  int added = 0;
  for (int i = 0; i < sk_X509_INFO_num(entries.get()); ++i) {
    const X509_INFO* entry = sk_X509_INFO_value(entries.get(), i);
    if (entry->x509 != nullptr && X509_STORE_add_cert(store, entry->x509) != 1) return false;
    if (entry->crl != nullptr && X509_STORE_add_crl(store, entry->crl) != 1) return false;
    added += (entry->x509 != nullptr) + (entry->crl != nullptr);
  }
  return added > 0;
}

}  // namespace

CertificateStore::CertificateStore(std::string file) {
  setFile(std::move(file));
}

void CertificateStore::setFile(std::string file) {
  file_ = std::move(file);
  watched_ = file_.empty() ? systemPlaces() : std::vector<std::string>{file_};
  read_.clear();
}

CertificateStore::~CertificateStore() {
  X509_STORE_free(store_);
}

CertificateStore::Seen CertificateStore::look(const std::string& path) {
  struct stat status = {};
  if (::stat(path.c_str(), &status) != 0) return {};
  return {status.st_dev, status.st_ino, status.st_size, status.st_ctim.tv_sec, status.st_ctim.tv_nsec};
}

void CertificateStore::load() {
  std::vector<Seen> now;
  for (const std::string& path : watched_) now.push_back(look(path));
  if (now == read_) return;
  Store fresh(X509_STORE_new());
  if (!fresh) return;
  if (file_.empty()) {
    if (X509_STORE_set_default_paths(fresh.get()) != 1) return;
  } else {
    const std::optional<std::string> contents = contentsOf(file_);
    if (!contents) return;
    // Being replaced, perhaps: what was read before still holds. It says the same until it changes.
    if (!addCertificates(fresh.get(), *contents)) {
      read_ = std::move(now);
      return;
    }
  }
  // An administrator may trust an intermediate authority alone.
  X509_STORE_set_flags(fresh.get(), X509_V_FLAG_TRUSTED_FIRST | X509_V_FLAG_PARTIAL_CHAIN);
  X509_STORE_free(store_);
  store_ = fresh.release();
  ++generation_;
  read_ = std::move(now);
}

unsigned CertificateStore::generation() {
  load();
  return generation_;
}

x509_store_st* CertificateStore::store() {
  load();
  return store_;
}

}  // namespace kyt
