#include "platform/linux/system/JournalPowerLog.h"

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "platform/Counters.h"
#include "platform/linux/system/Files.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DocumentBlock.h"

namespace kyt {
namespace {

// A journal of the test's own at the fixed address, in a mount namespace of its own.
TEST(JournalPowerLog, WritesAnEntryWhereThereIsAJournalAndCountsWhereThereIsNone) {
  if (!mayMountOfItsOwn()) GTEST_SKIP() << "needs root to mount over /run";
  EXPECT_EQ(inChildProcess([]() -> std::string {
              if (::unshare(CLONE_NEWNS) != 0 ||
                  ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                  ::mount("tmpfs", "/run", "tmpfs", 0, nullptr) != 0) {
                return "no mount namespace";
              }
              Counters counters;
              JournalPowerLog log(counters);
              // The worked example of docs/WIRE-POWERLOG.md, as its back end hands it over.
              const Dictionary event{
                  {"note", "two\nlines"}, {"ratio", 0.25}, {"method", 2u}, {"respCode", 3u}, {"event", 4u}};
              log.registeredEvent(28, "Medsrv-KYT", event);
              if (counters.value(Reason::powerLogUnavailable) != 1) return "not counted";
              ::mkdir("/run/systemd", 0755);
              ::mkdir("/run/systemd/journal", 0755);
              const FileHandle journal(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
              sockaddr_un address = {};
              address.sun_family = AF_UNIX;
              std::strcpy(address.sun_path, "/run/systemd/journal/socket");
              if (::bind(journal.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
                return "bind";
              log.registeredEvent(28, "Medsrv-KYT", event);
              char buffer[4096];
              const ssize_t count = ::recv(journal.get(), buffer, sizeof buffer, 0);
              if (counters.value(Reason::powerLogUnavailable) != 1) return "counted";
              return std::string(buffer, static_cast<size_t>(count > 0 ? count : 0));
            }),
            documentBlock("WIRE-POWERLOG.md", "text entry") + "\n");
}

}  // namespace
}  // namespace kyt
