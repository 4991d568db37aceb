// Access to clients' files through the descriptors that they passed: read here, removed by the broker.
//
// A file is read with positions of its own and never mapped into memory: the client shares the descriptor's
// position, and may cut the file at any moment. A user's clients together may have so many bytes of files in
// memory (Share::uploadedBytes); a file that finds too little room left is refused.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>

#include "platform/FileExtension.h"
#include "platform/base/UserBudget.h"
#include "platform/linux/helpers/DeletionBroker.h"

namespace kyt {

class Counters;
class Log;

class LinuxFileExtensions final : public FileExtensions {
 public:
  // Without a broker (null) files are never removed. All outlive the accesses.
  LinuxFileExtensions(const DeletionBroker* broker, Log& log, Counters& counters, UserBudget& budget)
      : broker_(broker), log_(log), counters_(counters), budget_(budget) {}
  [[nodiscard]] std::unique_ptr<FileAccess> consume(std::string_view token,
                                                    std::optional<FileExtension> extension) override;

 private:
  class Access;

  const DeletionBroker* const broker_;
  Log& log_;
  Counters& counters_;
  UserBudget& budget_;
};

}  // namespace kyt
