// Access to clients' files through the descriptors that they passed: read here, removed by the broker.
//
// A file is read with positions of its own and never mapped into memory: the client shares the descriptor's
// position, and may cut the file at any moment. A user's clients together may have so many bytes of files in
// memory; a file that finds too little room left is refused, but never the only one.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>

#include "platform/FileExtension.h"
#include "platform/Limits.h"
#include "platform/Mutex.h"
#include "platform/linux/system/DeletionBroker.h"

namespace kyt {

class Counters;
class Log;

class LinuxFileExtensions final : public FileExtensions {
 public:
  // Without a broker (null) files are never removed. All outlive the accesses.
  LinuxFileExtensions(const DeletionBroker* broker, Log& log, Counters& counters,
                      uint64_t mostOfOneUser = Limits::maxUploadingBytesPerUser)
      : broker_(broker), log_(log), counters_(counters), mostOfOneUser_(mostOfOneUser) {}
  [[nodiscard]] std::unique_ptr<FileAccess> consume(std::string_view token,
                                                    std::optional<FileExtension>& extension) override;

 private:
  class Access;
  [[nodiscard]] bool take(uint32_t user, uint64_t bytes);
  void giveBack(uint32_t user, uint64_t bytes);

  const DeletionBroker* const broker_;
  Log& log_;
  Counters& counters_;
  const uint64_t mostOfOneUser_;
  Mutex mutex_;
  std::map<uint32_t, uint64_t> bytesOfUsers_ GUARDED_BY(mutex_);  // that have any
};

}  // namespace kyt
