// The folder of signed storebags: NAME.plist, served as it is, and beside it optionally NAME.toml, which
// changes how:
//
//   max_age = 60               # seconds, instead of the server's
//   cache_control = "no-cache" # the whole header, instead of max-age
//   last_modified = false      # leave the header out, so that nothing is ever unchanged
//
// Files are read again when they change. A file that changed twice within one second gets a later
// Last-Modified than its modification time, since the header counts seconds and a client would else be told
// that nothing changed. Any thread.
#pragma once

#include <ctime>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>

#include "devserver/BagSigner.h"
#include "platform/base/Mutex.h"

namespace kyt::devserver {

struct Storebag {
  std::shared_ptr<const std::string> content;
  std::string lastModified;  // empty: no header
  std::string cacheControl;
  std::string problem;  // why it can't be served; then nothing else is set
};

class Storebags {
 public:
  Storebags(std::filesystem::path folder, unsigned maxAge, std::optional<BagSigner> signer)
      : folder_(std::move(folder)), maxAge_(maxAge), signer_(std::move(signer)) {}

  // Nothing when there is no such storebag.
  [[nodiscard]] std::optional<Storebag> find(const std::string& name) EXCLUDES(mutex_);

 private:
  struct Source {
    std::filesystem::path path;
    const char* format = nullptr;  // of an unsigned bag; null: the document itself
    std::time_t seconds = 0;
    std::tuple<int64_t, int64_t, uint64_t, int64_t> version;  // seconds, nanoseconds, inode, size
  };
  struct Entry {
    std::tuple<int64_t, int64_t, uint64_t, int64_t> version;
    std::time_t lastModified = 0;
    std::shared_ptr<const std::string> content;
  };
  [[nodiscard]] std::optional<Source> sourceOf(const std::string& name) const;
  [[nodiscard]] std::variant<std::string, SigningError> documentOf(const Source& source) const;
  void applyOverrides(const std::string& name, Storebag& bag) const;

  const std::filesystem::path folder_;
  const unsigned maxAge_;
  const std::optional<BagSigner> signer_;
  Mutex mutex_;
  std::map<std::string, Entry> entries_ GUARDED_BY(mutex_);
};

}  // namespace kyt::devserver
