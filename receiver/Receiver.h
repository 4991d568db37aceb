// The composition root of kytreceiver: makes everything from the settings, runs until it is told to end, and takes it down
// again in an order in which no post that was answered is lost.
#pragma once

#include <functional>
#include <string>

#include "platform/linux/base/StopSignals.h"
#include "platform/queues/Log.h"
#include "receiver/EventLog.h"
#include "receiver/PostHandler.h"
#include "receiver/Settings.h"

namespace kyt::receiver {

struct ReceiverOptions {
  PostHandler::Options posts;
  std::string readyFile;  // written when the ports are open: their numbers as JSON; empty: none
};

// Blocks until SIGTERM or SIGINT. The exit status; what is wrong is said in the log.
[[nodiscard]] int runReceiver(const Settings& settings, const ReceiverOptions& options, EventLog& log,
                              StopSignals& signals, Log& lines);

}  // namespace kyt::receiver
