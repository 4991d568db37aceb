// What clients, users and servers may take of the daemon, each with its unit and reason; a limit of one format or helper
// stands beside its code. What passes one is refused or dropped, counted (Counters.h) and logged once a minute.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>

#include "platform/base/Adjustable.h"

namespace kyt {

// Set in kytreportingd.toml; the numbers are the defaults. Those that code reads whenever it needs them may change while
// the daemon runs (daemon/DaemonReload.h).
struct Limits {
  Adjustable<uint64_t> maxMessageBytes = 1048576;  // one IPC message, header and body: a client's buffer
  Adjustable<uint64_t> maxQueuedBytes =
      4194304;  // replies and callbacks waiting for one client; twice that ends it
  Adjustable<uint64_t> maxConnections = 16384;            // all clients: descriptors
  Adjustable<uint64_t> maxConnectionsPerUser = 4096;      // one user cannot shut out the others
  Adjustable<uint64_t> maxUploadBytes = 268435456;        // one file: it is read into memory
  Adjustable<uint64_t> maxBatchBytes = 16777216;          // one back end's batch; then new events are dropped
  Adjustable<uint64_t> maxHierarchyTokensPerUser = 4096;  // tokens' arrays stay for the life of the process
  Adjustable<uint64_t> maxSharedDataBytesPerUser = 16777216;  // so does their shared data
  Adjustable<uint64_t> maxCustomIdentifiersPerUser = 250;     // of the 1,000 that are kept for good
  // Of one user's clients together; without a value a part of the memory and the descriptors there are
  // (platform/base/UserBudget.h).
  std::optional<uint64_t> maxBytesPerUser;           // memory, but for files that are uploaded
  std::optional<uint64_t> maxUploadingBytesPerUser;  // files, read and not yet answered
  std::optional<uint64_t> maxDescriptorsPerUser;     // connections, and what came with unfinished messages
  double idleExitSeconds = 30;                       // socket-activated and without a session
  Adjustable<double> shutdownGraceSeconds = 5;       // from SIGTERM to cancelling what is left

  friend bool operator==(const Limits&, const Limits&) = default;

  // Fixed.
  static constexpr int maxObjectDepth = 32;  // property lists and JSON: recursion
  static constexpr int maxIPCDepth = 64;     // the wire protocol's own: 32 arrays + 32 structs, and variants
  static constexpr size_t maxHTTPReplyBytes = 4u << 20;  // a server cannot fill the memory
  // An HTTP request on its way, progress or not: so many seconds, and one more for each so many bytes of its body. A
  // server that takes or gives a byte now and then cannot hold the thread that waits for it; the slowest links carry more.
  static constexpr double requestSeconds = 300;
  static constexpr size_t leastBodyBytesPerSecond = 2048;
  static constexpr size_t maxPropertyListTags = 131072;  // each takes up to 128 bytes while it is read
  // Requests waiting for connectivity, each user's in each URL session.
  static constexpr size_t maxWaitingBytes = 16u << 20;
  // Requests started and not completed, each user's in each URL session: a server that answers slowly, or never, cannot
  // make a fast client fill the memory.
  static constexpr size_t maxOutstandingBytes = 64u << 20;
  // Of one user's files, read and not yet answered, however much memory there is: each of a user's many sessions may
  // upload at the same time.
  static constexpr uint64_t maxUploadingBytes = 256u << 20;
  // Requests on their way at once, all sessions; further ones wait in line. Each has a connection of some 45 KiB and a
  // descriptor, and clients that come and go start them faster than servers answer.
  static constexpr size_t maxActiveRequests = 1024;
  static constexpr size_t maxActiveRequestsToOneServer = 512;  // one without answers leaves others room
  // Of one user to one server: so many requests, and further ones while the bodies on their way have less than so many
  // bytes. More is only waiting at a server that takes as long for each, and other users' requests come after it.
  static constexpr size_t activeRequestsOfUserToOneServer = 16;
  static constexpr size_t smallRequestBytesOfUserToOneServer = 1u << 20;
  static constexpr size_t maxWorkers = 512;                    // threads
  static constexpr size_t maxWorkersPerUser = maxWorkers / 2;  // blocked ones of one user leave others some
  static constexpr size_t maxHandshakeBytes = 16384;           // before authentication
  static constexpr std::chrono::seconds handshakeTime{30};
  static constexpr std::chrono::seconds messageTime{
      30};  // once begun; it keeps memory and descriptors until its end
  static constexpr size_t maxDescriptorsPerMessage = 16;
  // What a connection and its session count, before they hold anything.
  static constexpr size_t connectionBytes = 32768;
  // … and this more while the socket's buffer is full, since its client does not read.
  static constexpr size_t socketBytes = 212992;
  static constexpr size_t freeBytes = 4096;      // what each may hold besides: counted with the connection
  static constexpr unsigned turnCalls = 256;     // a connection hands its worker back after so many calls
  static constexpr size_t turnBytes = 1u << 20;  // … or so many bytes
  // … or so much time, looked at after every so many calls: other clients' calls wait behind it.
  static constexpr std::chrono::microseconds turnTime{200};
  static constexpr unsigned turnTimeCalls = 16;
  static constexpr size_t maxLogLineBytes = 16384;       // what clients and servers sent is shown in them
  static constexpr size_t maxQueuedLogBytes = 1u << 20;  // lines that wait for whoever reads the log
  // Power-log events that wait for a journal that is slow or stopped.
  static constexpr size_t maxQueuedPowerLogBytes = 1u << 20;
  // Of one text, above the debug level, for the clients of one user: the journal's own limit would hit everybody.
  static constexpr unsigned maxLogLinesPerSecond = 200;
  static constexpr uint64_t maxMessageLogBytes = 64u << 20;  // a day's file: clients cannot fill the disk
  // … nor those of one user push out others' lines.
  static constexpr uint64_t maxMessageLogBytesPerUser = maxMessageLogBytes / 4;
  static constexpr size_t maxCustomIdentifiers = 1000;  // "uuid:…" user defaults that the daemon writes
  // The books' rows stay for the life of the process, and clients choose the names of programs: memory.
  static constexpr size_t maxBookRows = 1024;
  static constexpr size_t bookRowsForOthers = 128;  // of these, those named "other"
  static constexpr size_t maxBookRowsOfUser = 448;  // … and half of the rest, so no user fills it
  static constexpr size_t maxBookNameBytes = 128;   // what is longer is cut
  // That one answer to an administrator shows: some 700 bytes each, and two megabytes wait for nobody.
  static constexpr size_t maxShownSessions = 2048;
  // Who watches events pass: each is looked for with every event while anybody watches.
  static constexpr size_t maxWatchers = 4;
  static constexpr size_t maxWatchersOfGroup = maxWatchers - 1;  // root and the daemon's user find one free
  static constexpr size_t maxWatchedEvents = 1024;  // that wait for one: some 700 bytes each; a power of two
  static constexpr size_t maxWatchedBodyBytes = 65536;  // of one body, the beginning
  static constexpr size_t maxWatchedBodies = 4u
                                             << 20;  // bytes, for all watchers; further bodies are left out
  static constexpr std::chrono::milliseconds watchPeriod{100};  // between looks at what waits for a watcher
  // Of the outbox, besides what is set: posts, since each takes 40 bytes of memory; bytes that wait for a slow disk;
  // bytes that are sent again at a time (one post to each server goes in any case).
  static constexpr size_t maxOutboxPosts = 131072;
  static constexpr size_t maxOutboxPostsOfAUser =
      maxOutboxPosts / 8 * 7;  // so that small ones displace no other user's
  static constexpr size_t maxBytesOnTheWayToTheOutbox = 8u << 20;
  static constexpr size_t maxBytesOfAUserOnTheWayToTheOutbox = 2u << 20;
  // A post that is not on its disk by then goes the usual way, so that no session waits longer for a disk that is stuck.
  static constexpr std::chrono::seconds outboxCommitTime{5};
  static constexpr size_t maxOutboxBytesInFlight = 4u << 20;
  // Requests of it at a time, to all servers: servers that are silent leave room for what is posted meanwhile. Those to
  // servers that take long to answer, or of which nothing is known yet: they leave room for the others.
  static constexpr size_t maxOutboxRequestsInFlight = 64;
  static constexpr size_t maxOutboxRequestsToSlowServers = maxOutboxRequestsInFlight / 2;
  static constexpr std::chrono::seconds outboxSlowAnswer{10};
  // As long as there are fewer than so many to servers that answer soon, more than one goes to one of these.
  static constexpr size_t mostOutboxRequestsBesideOthers = maxOutboxRequestsInFlight / 2;
  // Servers of which its disk knows that they want to be left alone: each is some 30 bytes there.
  static constexpr size_t maxOutboxPauses = 1024;
  // Different contents of kept posts, by whose events they are and how many, that it knows without reading them: each is
  // some 200 bytes.
  static constexpr size_t maxKnownOutboxContents = 4096;
  // Kept posts of which it knows the events' categories, for watchers: each is some KiB.
  static constexpr size_t maxWatchedKeptPosts = 256;
};

}  // namespace kyt
