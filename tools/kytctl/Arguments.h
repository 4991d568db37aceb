// The command line of kytctl: what it is read into, and the functions that add its commands, a file for each kind of them.
// main() has one Arguments, which outlives the parse; a command leaves its exit status there. One thread.
#pragma once

#include <string>

#include "platform/linux/cli/CommandLine.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

struct Arguments {
  ConnectionOptions connection;
  SendOptions send;
  ListenOptions listen;
  SignOptions sign;
  CheckOptions check;
  ExplainOptions explain;
  SimulateOptions simulate;
  EventsOptions events;
  GenerateOptions generate;
  PublishOptions publish;
  ProbeOptions probe;
  RingOptions ring;
  WatchOptions watch;
  MetricsOptions metrics;
  OutboxDropOptions drop;
  std::string script, domain, key, value, type = "string", folder, document, publicKey, oldBag, newBag;
  unsigned bits = 2048;
  std::string level, server;
  bool json = false;
  int status = 0;
  int unwritten = 1;  // the status at least, of a command whose output is lost
};

// What programs report: ReportingArguments.cpp.
void addSend(const Command& program, Arguments& a);
void addListen(const Command& program, Arguments& a);
void addExplain(const Command& program, Arguments& a);
void addEvents(const Command& program, Arguments& a);
// What a device keeps, and who may connect: DeviceArguments.cpp.
void addDefaults(const Command& program, Arguments& a);
void addOwner(const Command& program, Arguments& a);
void addEntitlements(const Command& program, Arguments& a);
// Storebags, from keys to servers: StorebagArguments.cpp.
void addStorebag(const Command& program, Arguments& a);
// The running daemon: WindowArguments.cpp.
void addWindow(const Command& program, Arguments& a);
void addOutbox(const Command& program, Arguments& a);

}  // namespace kyt::tools
