#include "platform/linux/system/JournalPowerLog.h"

#include <sys/uio.h>

#include <iterator>
#include <string>
#include <variant>

#include "platform/Counters.h"
#include "platform/Log.h"
#include "platform/linux/system/LogSinks.h"
#include "platform/linux/system/SystemdLibrary.h"

namespace kyt {

void JournalPowerLog::registeredEvent(uint32_t agent, std::string_view event, const Dictionary& dictionary) {
  // Without its socket libsystemd would report success and drop every entry.
  const auto loaded = JournalSink::isAvailable() ? SystemdLibrary::load() : std::string("no journal");
  const auto* systemd = std::get_if<SystemdLibrary>(&loaded);
  if (systemd == nullptr) {
    counters_.add(Reason::powerLogUnavailable);
    return;
  }
  const std::string number = std::to_string(agent), name(event);
  const std::string fields[] = {"MESSAGE=Power-log event " + name + " of agent " + number,
                                "PRIORITY=6",
                                "SYSLOG_IDENTIFIER=kytreportingd",
                                "KYT_AGENT=" + number,
                                "KYT_EVENT=" + name,
                                "KYT_DICTIONARY=" + description(Value(dictionary))};
  iovec parts[std::size(fields)];
  for (size_t i = 0; i < std::size(fields); ++i)
    parts[i] = {const_cast<char*>(fields[i].data()), fields[i].size()};
  if (systemd->journalSend(parts, static_cast<int>(std::size(fields))) < 0)
    counters_.add(Reason::powerLogUnavailable);
}

}  // namespace kyt
