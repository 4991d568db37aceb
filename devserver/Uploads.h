// Files that devices upload: judged, undone of gzip, and kept in STATE/uploads/UUID/SEQUENCE/NAME. Any thread,
// no state of its own; the last upload of a name wins.
#pragma once

#include <cstdint>
#include <filesystem>
#include <utility>

#include "devserver/Http.h"
#include "devserver/Post.h"

namespace kyt::devserver {

class Uploads {
 public:
  Uploads(std::filesystem::path folder, uint64_t maxInflatedBytes)
      : folder_(std::move(folder)), maxInflatedBytes_(maxInflatedBytes) {}
  // Fills the verdict in, and the names that the page shows: the sender "upload", the file's name as the
  // client, the device as the service. Precondition: the post's headers and body are whole.
  void keep(const Request& request, Post& post) const;

 private:
  const std::filesystem::path folder_;
  const uint64_t maxInflatedBytes_;
};

}  // namespace kyt::devserver
