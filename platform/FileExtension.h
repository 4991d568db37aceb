// Access to one file of a client, for one call: what stands here for a sandbox extension token. A client opens
// the file and its folder and passes both descriptors with the call; the token's text names them and means
// nothing else. Only those descriptors count: no path that a client names is ever opened.
//
// Used by back ends that upload files. Any thread; one access is used by one thread at a time. Reading and
// removing wait for the client's file system; they announce that themselves (BlockingScope).
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/base/Descriptor.h"
#include "platform/objects/Value.h"

namespace kyt {

// Whose rights a deletion needs: those of the connection's other end, as of the moment it connected.
struct PeerIdentity {
  uint32_t user = ~0u, group = ~0u;
  std::vector<uint32_t> groups;  // supplementary
};

// The descriptors that came with an upload: the open file and its folder.
struct FileExtension {
  Descriptor file;    // opened for reading by the client
  Descriptor folder;  // its folder, opened with O_PATH
  PeerIdentity peer = {};
};

enum class FileReadError : uint8_t {
  tooLarge,
  tooMuchAtOnce,  // of this user's files; later there may be room
  failed
};

// One upload's descriptors while it is offered to back ends, one after the other: the first that takes them owns them,
// and for the others there are none. What nobody took is closed at destruction.
class FileOffer {
 public:
  explicit FileOffer(std::optional<FileExtension> extension) : extension_(std::move(extension)) {}
  // None where none came with the call, or somebody took them before.
  [[nodiscard]] std::optional<FileExtension> take() { return std::exchange(extension_, std::nullopt); }

 private:
  std::optional<FileExtension> extension_;
};

// What a consumed token gives. Released at destruction.
class FileAccess {
 public:
  virtual ~FileAccess() = default;
  // A regular file that was opened for reading. Nothing else may be read; asking reads nothing.
  [[nodiscard]] virtual bool isReadableRegularFile() = 0;
  // The file from its beginning, as long as it is when reading begins: what is appended meanwhile is left out,
  // what is cut off is missing. One longer than `maxBytes` is not read. What is read counts against what the
  // client's user may have in memory at once, until the release.
  [[nodiscard]] virtual std::variant<Data, FileReadError> readWhole(uint64_t maxBytes) = 0;
  // Of what was read only so many bytes are still held, in another form.
  virtual void holdsOnly(uint64_t bytes) = 0;
  // Removes the folder's entry of that name with the rights of the client, provided that it is still this very
  // file.
  [[nodiscard]] virtual bool remove(std::string_view name) = 0;
};

class FileExtensions {
 public:
  virtual ~FileExtensions() = default;
  // Null for an empty token, and without descriptors; then those that are given are closed.
  [[nodiscard]] virtual std::unique_ptr<FileAccess> consume(std::string_view token,
                                                            std::optional<FileExtension> extension) = 0;
};

}  // namespace kyt
