#include "platform/linux/url/CertificateStore.h"

#include <openssl/x509_vfy.h>

namespace kyt {

CertificateStore::~CertificateStore() {
  X509_STORE_free(store_);
}

bool CertificateStore::load() {
  struct stat now {};
  if (!file_.empty()) {
    if (stat(file_.c_str(), &now) != 0)
      return store_ != nullptr;  // being replaced: what was read still holds
    const bool unchanged = now.st_ino == read_.st_ino && now.st_size == read_.st_size &&
                           now.st_ctim.tv_sec == read_.st_ctim.tv_sec &&
                           now.st_ctim.tv_nsec == read_.st_ctim.tv_nsec;
    if (store_ != nullptr && unchanged) return true;
  } else if (store_ != nullptr) {
    return true;
  }
  X509_STORE* fresh = X509_STORE_new();
  if (fresh == nullptr) return store_ != nullptr;
  const int good =
      file_.empty() ? X509_STORE_set_default_paths(fresh) : X509_STORE_load_file(fresh, file_.c_str());
  if (good != 1) {
    X509_STORE_free(fresh);
    return store_ != nullptr;
  }
  // An administrator may trust an intermediate authority alone.
  X509_STORE_set_flags(fresh, X509_V_FLAG_TRUSTED_FIRST | X509_V_FLAG_PARTIAL_CHAIN);
  X509_STORE_free(store_);
  store_ = fresh;
  read_ = now;
  return true;
}

x509_store_st* CertificateStore::store() {
  return load() ? store_ : nullptr;
}

}  // namespace kyt
