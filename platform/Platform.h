// All ports of the operating system that the daemon's folders use, as references that the composition root fills in.
// Everything outlives everything that holds a Platform&.
#pragma once

namespace kyt {

class Books;
class Bundle;
class Clock;
class Counters;
class Cryptography;
class Deflate;
class Departures;
class DeviceProperties;
class DiagnosticsConsent;
class Executor;
class FileExtensions;
class JSON;
class LargeWork;
class Log;
class MemoryInfo;
class PluginBundles;
class PowerLog;
class PropertyLists;
class RandomSource;
class Reactor;
class TimerService;
class UDPSocketFactory;
class URLSessionFactory;
class UserBudget;
class UserDefaults;
struct Limits;

struct Platform {
  const Limits& limits;
  Counters& counters;
  Log& log;
  Clock& clock;
  TimerService& timers;
  Reactor& reactor;
  Executor& executor;
  LargeWork& largeWork;
  RandomSource& random;
  UserDefaults& userDefaults;
  DeviceProperties& deviceProperties;
  DiagnosticsConsent& consent;
  Cryptography& cryptography;
  PropertyLists& propertyLists;
  JSON& json;
  Deflate& deflate;
  MemoryInfo& memory;
  URLSessionFactory& urlSessions;
  UDPSocketFactory& udpSockets;
  Bundle& clientBundle;  // KYTReporting.bundle: version, publicKey.der
  Bundle& daemonBundle;  // kytreportingd.bundle: version
  FileExtensions& fileExtensions;
  PluginBundles& pluginBundles;
  PowerLog& powerLog;
  UserBudget& budget;
  Books& books;
  Departures& departures;
};

}  // namespace kyt
