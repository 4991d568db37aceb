// Which program file a process runs, as device and inode. Entitlements ask it about a connection's peer.
//
// A confined process cannot ask: Landlock keeps it from looking at processes outside its own confinement,
// whatever its privileges. So a small process is forked before the confinement is entered and asks on the
// daemon's behalf. It knows one question, takes a process number and answers two numbers and a path; it ends when
// the daemon does.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <variant>

#include "platform/linux/helpers/HelperProcess.h"
#include "platform/queues/Gate.h"

namespace kyt {

struct ProgramIdentity {
  uint64_t device = 0, inode = 0;
  friend bool operator==(const ProgramIdentity&, const ProgramIdentity&) = default;
};

// Any thread.
class ProgramInspector {
 public:
  virtual ~ProgramInspector() = default;
  // The program of the process that has this number now, or errno: EACCES: not allowed to know; ENOENT: it is ending
  // and runs nothing any more; ESRCH: there is no such process, or none that may be seen. The caller makes sure
  // afterwards that the process it means was still alive.
  [[nodiscard]] virtual std::variant<ProgramIdentity, int> runningProgram(int32_t pid) = 0;
  // Where that program was found when it was started, cut to some 250 bytes; empty when that may not be known.
  [[nodiscard]] virtual std::string programPath(int32_t pid) = 0;
};

// Asks itself: for processes that are not confined.
class DirectProgramInspector final : public ProgramInspector {
 public:
  [[nodiscard]] std::variant<ProgramIdentity, int> runningProgram(int32_t pid) override;
  [[nodiscard]] std::string programPath(int32_t pid) override;
};

struct ProgramAnswer;

class ProgramInspectorProcess final : public ProgramInspector {
 public:
  // Only before there are threads and before the confinement. An error's text when it cannot be started.
  [[nodiscard]] static std::variant<std::unique_ptr<ProgramInspectorProcess>, std::string> start();
  // Waits for the answer, two seconds at most. One that stands still is waited for once: until it has answered that
  // question all others fail at once (ETIMEDOUT).
  [[nodiscard]] std::variant<ProgramIdentity, int> runningProgram(int32_t pid) override EXCLUDES(asking_);
  [[nodiscard]] std::string programPath(int32_t pid) override EXCLUDES(asking_);

 private:
  explicit ProgramInspectorProcess(std::unique_ptr<HelperProcess> process) : process_(std::move(process)) {}
  [[nodiscard]] ProgramAnswer ask(int32_t pid) EXCLUDES(asking_);

  Gate asking_;
  const std::unique_ptr<HelperProcess> process_ PT_GUARDED_BY(asking_);
  unsigned unanswered_ GUARDED_BY(asking_) = 0;
};

}  // namespace kyt
