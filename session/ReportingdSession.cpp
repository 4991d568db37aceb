// The life of a session: made, identified, configured, re-configured by new user information, ended.
#include "session/ReportingdSession.h"

#include <cassert>
#include <utility>

#include "platform/Bundle.h"
#include "platform/DeviceProperties.h"
#include "platform/Platform.h"
#include "platform/RandomSource.h"
#include "platform/UserDefaults.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/Base64.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"
#include "platform/objects/ObjectSize.h"
#include "platform/queues/Log.h"
#include "session/ReportingSessionConnectivityHelper.h"
#include "session/ReportingdSessionClass.h"
#include "session/SessionInfoCheck.h"

namespace kyt {

namespace {

constexpr uint16_t kInternalMethod = 0;
constexpr uint16_t kStartMessage = 0;
constexpr uint16_t kStopMessage = 1;

// A missing value on the new side never equals, not even a missing one.
bool isSameName(const std::optional<Dictionary>& newInfo, const Dictionary& oldInfo, const char* key) {
  const String* newName = newInfo ? newInfo->string(key) : nullptr;
  const String* oldName = oldInfo.string(key);
  return newName != nullptr && oldName != nullptr && *newName == *oldName;
}

}  // namespace

std::shared_ptr<ReportingdSession> ReportingdSession::initWithSessionDelegate(
    ReportingdSessionDelegate& delegate, std::shared_ptr<Connection> connection,
    ReportingdSessionClass& sessionClass) {
  return std::shared_ptr<ReportingdSession>(
      new ReportingdSession(delegate, std::move(connection), sessionClass));
}

ReportingdSession::ReportingdSession(ReportingdSessionDelegate& delegate,
                                     std::shared_ptr<Connection> connection,
                                     ReportingdSessionClass& sessionClass)
    : class_(sessionClass),
      _sessionDelegate(delegate),
      peerUser_(connection->peerUser()),
      userAccount_(connection->userAccount()),
      _connection(std::move(connection)),
      information_(userAccount_, Share::bytes) {
  log().debug("initWithSessionDelegate: ReportingdSession initWithSessionDelegate:%s",
              delegate.description().c_str());
  class_.deviceIdentity().deviceUniqueIDCString(_deviceid.data(), kDeviceIDSize);
  _sessionIDString = base64(platform().random.uuidBytes());
  _connectivityHelper = ReportingSessionConnectivityHelper::init(platform().urlSessions);
  SessionView first;
  first.user = peerUser_;
  first.process = _connection->peerProcess();
  first.identifier = _sessionIDString.str();
  first.since = static_cast<int64_t>(platform().clock.timeOfDay().asSeconds());
  standing_ = class_.standings().add(std::move(first));
  log().debug("initWithSessionDelegate: Initialized session with UUID %s", _sessionIDString.c_str());
}

ReportingdSession::~ReportingdSession() = default;

Log& ReportingdSession::log() const {
  return platform().log;
}

Counters& ReportingdSession::counters() const {
  return platform().counters;
}

std::string ReportingdSession::description() const {
  return formatObjects("<ReportingdSession %@>", {_sessionIDString});
}

bool ReportingdSession::requiresUserInfo() const {
  return _sessionInfo && _sessionInfo->boolean(kKYTReportingSessionInfoRequireUserInfo);
}

// The exchange makes sure that either the report that has just asked saw the change, or the next one is told.
void ReportingdSession::figuresMayHaveChanged() {
  if (!figuresChanged_.exchange(true)) _sessionDelegate.sessionFiguresMayHaveChanged(*this);
}

// Under one hold of the monitor, so that no other session finds the new level under the old registration. A session
// that never had a token is found by nobody, and does not wait for the monitor, which somebody's download may hold.
void ReportingdSession::takeOverIdentity(const Dictionary& sessionInfo) {
  countMistakes(sessionInfo, platform());
  const Dictionary* hierarchy = sessionInfo.dictionary(kKYTReportingSessionInfoHierarchyToken);
  const Value* tokenID = hierarchy != nullptr ? hierarchy->find(kKYTReportingHierarchyTokenTokenID) : nullptr;
  if (tokenID != nullptr && !tokenID->isNull()) wasInHierarchy_ = true;
  std::optional<MonitorLock> lock;
  if (wasInHierarchy_) lock.emplace(_sessionDelegate.monitor());
  _sessionID = sessionInfo.unsignedInteger(kKYTReportingSessionInfoSessionID);
  _sessionInfo = sessionInfo;
  _hierarchyDictionary.reset();
  if (hierarchy != nullptr) _hierarchyDictionary = *hierarchy;
  clientType_.store(sessionInfo.integer(kKYTReportingSessionInfoClientType), std::memory_order_relaxed);
  figuresMayHaveChanged();
  _sessionDelegate.updateCorrelatedSessions(*this);
  identifyProgram();
}

void ReportingdSession::setSessionInfo(Dictionary sessionInfo, std::optional<Dictionary> userInfo,
                                       Value frameworksToCheck, bool hasAggregationBlock) {
  log().debug("setSessionInfo: Configuring session %u",
              sessionInfo.unsignedInteger(kKYTReportingSessionInfoSessionID));
  if (userInfo && !sessionInfo.boolean(kKYTReportingSessionInfoRequireUserInfo))
    log().error("setSessionInfo: Configure session: user info provided without requiring it");
  takeOverIdentity(sessionInfo);
  _frameworks = std::move(frameworksToCheck);
  _userInfo = std::move(userInfo);
  identifyProgram();
  countInformation();
  std::optional<MonitorLock> lock;
  if (wasInHierarchy_) lock.emplace(_sessionDelegate.monitor());
  setHasAggregator(hasAggregationBlock);
}

// What the books know of the session. Events that came before belong to the program that it was then.
void ReportingdSession::identifyProgram() {
  ReportingProgram program = programOf(peerUser_, clientType(), _userInfo);
  if (program_ != nullptr && *program_ == program) return publishIdentity();
  program_ = std::make_shared<const ReportingProgram>(std::move(program));
  withoutBackend_ = {};
  for (const auto& [key, backend] : _backends) backend->setProgram(program_);
  publishIdentity();
}

void ReportingdSession::publishIdentity() {
  if (standing_ == nullptr) return;
  const std::optional<String> token = hierarchyToken();
  standing_->publish([&](SessionView& view) {
    view.sessionID = _sessionID;
    view.clientType = clientType();
    view.clientName = program_ != nullptr ? shownName(program_->clientName) : std::string();
    view.service = program_ != nullptr ? shownName(program_->service) : std::string();
    view.token = token ? shownName(beginningOf(token->view())) : std::string();
    view.level = hierarchyLevel();
  });
}

void ReportingdSession::publishBackends() {
  if (standing_ == nullptr) return;
  std::vector<std::shared_ptr<const BackEndStanding>> backEnds;
  for (const auto& [key, backend] : _backends) backEnds.push_back(backend->standing());
  standing_->publish([&](SessionView& view) {
    std::swap(view.backEnds, backEnds);
    view.storebagVersion = _storebagVersion ? shownName(_storebagVersion->view()) : std::string();
  });
}

// Little of it counts with the connection. A client whose user has no room for it goes.
void ReportingdSession::countInformation() {
  size_t bytes = roughSize(_frameworks);
  if (_sessionInfo) bytes += roughSize(*_sessionInfo);
  if (_userInfo) bytes += roughSize(*_userInfo);
  if (_digestKey) bytes += _digestKey->size();
  if (information_.set(bytes > Limits::freeBytes ? bytes : 0)) return;
  information_.setAnyway(bytes);
  if (platform().counters.addAndMayLog(Reason::userBytesExceeded, platform().clock.monotonic()))
    log().error("setSessionInfo: User %u holds too many bytes for the information of session %u", peerUser_,
                _sessionID);
  if (_connection) _connection->invalidate();
}

void ReportingdSession::startConfigWithCompletionHandler(StatesReply reply) {
  log().debug("startConfigWithCompletionHandler: Starting configuration for session %u", _sessionID);
  const std::optional<Dictionary> storebag = _sessionDelegate.storebagForSession(*this);
  withoutBackends_ = storebag ? Reason::noBackEnds : Reason::noStorebag;
  if (!storebag) {
    tellDrop(Reason::noStorebag, "there is no storebag for this client type");
    if (reply) reply(std::nullopt);
    return;
  }
  _storebagVersion = _sessionDelegate.storebagVersionForSession(*this);
  createBackendsWithStorebag(*storebag);
  updateSessionWithDefaultSessionInfo();
  sendStartMessage();
  if (reply) reply(fetchReportingStates());
}

void ReportingdSession::createBackendsWithStorebag(const Dictionary& storebag) {
  log().debug("createBackendsWithStorebag: Creating backends for session %u", _sessionID);
  Backends backends = class_.backendFactory()
                          .createBackends(storebag, _sessionInfo, _userInfo, String(_deviceid.data()))
                          .value_or(Backends());
  for (const auto& [key, backend] : backends) {
    backend->setUserAccount(userAccount_);
    backend->setAnswerReader(this);
    backend->setProgram(program_);
    backend->setReportingSessionConnectivityDelegate(_connectivityHelper);
    backend->setCombinedSessionIDString(_sessionIDString);
  }
  // What back ends of an earlier configuration hold in batches would be lost with them.
  if (hasBackends()) internalFlushMessagesWithCompletion(nullptr);
  {
    MonitorLock lock(_sessionDelegate.monitor());
    std::swap(_backends, backends);
  }
  publishBackends();
  figuresMayHaveChanged();
  for (const auto& [key, backend] : backends) backend->cleanup();
}

void ReportingdSession::updateSessionWithDefaultSessionInfo() {
  updateReportingStates();
  _sessionDelegate.updateDownstreamSessions(*this);
}

void ReportingdSession::sendStartMessage() {
  const TimeValue timestamp = platform().clock.timeOfDay();
  DeviceIdentity& device = class_.deviceIdentity();
  const String unknown("Unknown");
  // Asked of the device on every build, although only an internal one tells them.
  const String productVersion = device.productVersion().value_or(unknown);
  const String buildVersion = device.buildVersion().value_or(unknown);
  const String deviceName = device.deviceName().value_or(unknown);
  const String serialNumber = device.serialNumber().value_or(unknown);
  const String hardwareModel = device.hardwareModel().value_or(unknown);
  const String countryCode = platform().deviceProperties.countryCode().value_or(unknown);
  const String reportVersion = platform().clientBundle.version().value_or("8.0");
  const Value automaticTime =
      platform().userDefaults.value(kTimedDefaultsDomain, "TMAutomaticTimeZoneEnabled");
  const bool automaticTimeSet = automaticTime.isNull() || automaticTime.boolValue();

  Dictionary payload;
  if (device.isInternalBuild()) {
    payload = Dictionary{{"SerialNum", serialNumber}, {"Version", productVersion},
                         {"Build", buildVersion},     {"Hardware", hardwareModel},
                         {"Product", deviceName},     {"ReportVers", reportVersion},
                         {"Locale", countryCode},     {"AutomaticTimeSet", automaticTimeSet}};
  } else {
    payload = Dictionary{{"AutomaticTimeSet", automaticTimeSet}, {"Locale", countryCode}};
  }
  internalSendMessage(std::move(payload), timestamp, kInternalMethod, kStartMessage);
}

void ReportingdSession::fetchStatesWithUserInfo(std::optional<Dictionary> userInfo, StatesReply reply) {
  log().debug("fetchStatesWithUserInfo: Fetching states for session %u", _sessionID);
  receivedUserInfo(userInfo);
  if (reply) reply(fetchReportingStates());
}

void ReportingdSession::receivedUserInfo(const std::optional<Dictionary>& userInfo) {
  bool changed = true;
  if (_userInfo) {
    if (!userInfo && requiresUserInfo()) return;
    changed = !isSameName(userInfo, *_userInfo, kKYTReportingUserInfoClientName) ||
              !isSameName(userInfo, *_userInfo, kKYTReportingUserInfoServiceName);
  } else if (!userInfo) {
    return;
  }
  _userInfo = userInfo;
  identifyProgram();
  countInformation();
  updateUserInfoForBackends();
  if (!changed) return;
  log().debug("receivedUserInfo: Received new user info for session %u", _sessionID);
  updateSessionWithDefaultSessionInfo();
}

void ReportingdSession::updateUserInfoForBackends() {
  for (const auto& [key, backend] : _backends) {
    backend->setUserInfoDict(_userInfo);
    if (key != kKYTReportingBackendQRS) continue;
    backend->setDigestKey(_digestKey);
    backend->setDigestAlgorithm(_digestAlgorithm);
  }
}

// The algorithm's number is deliberately not kept: the next user information hands the back end the kept key
// with the algorithm 0, and servers that expect that would refuse digests of another.
void ReportingdSession::setDigestKey(Data key, int32_t algorithm) {
  _digestKey = std::move(key);
  countInformation();
  KYTReportingBackend* backend = _backends.find(kKYTReportingBackendQRS);
  if (backend == nullptr) return;
  backend->setDigestKey(_digestKey);
  backend->setDigestAlgorithm(algorithm);
}

void ReportingdSession::fetchDisplayURL(StringReply reply) {
  log().debug("fetchDisplayURL: Fetching display URL for session %u", _sessionID);
  KYTReportingBackend* candidate = _backends.find(kKYTReportingBackendHTTPPost);
  if (candidate == nullptr || !candidate->displayURL())
    candidate = _backends.find(kKYTReportingBackendHTTPPost2);
  if (candidate == nullptr || !candidate->displayURL())
    candidate = _backends.find(kKYTReportingBackendDashboard);
  if (!reply) return;
  reply(candidate != nullptr && candidate->displayURL() ? *candidate->displayURL()
                                                        : String("URL not available"));
}

void ReportingdSession::finishSessionGracefully() {
  _hasFinishedGracefully = true;
  log().debug("finishSessionGracefully: Session %u has been finished gracefully", _sessionID);
}

void ReportingdSession::dealloc() {
  assert(!ended_);
  ended_ = true;
  log().debug("dealloc: ReportingdSession dealloc: %u", _sessionID);
  const TimeValue timestamp = platform().clock.timeOfDay();
  Dictionary payload;
  if (_storebagVersion) {
    payload.set("StorebagVersion", *_storebagVersion);
    payload.set("GracefulTermination", _hasFinishedGracefully);
  }
  {
    MonitorLock lock(_sessionDelegate.monitor());
    _sessionDelegate.addAgentHealthInfoForSession(*this, payload);
  }
  if (hasBackends()) {
    internalSendMessage(std::move(payload), timestamp, kInternalMethod, kStopMessage);
    flushMessagesWithCompletion(nullptr);
  }
  shutdownSessionAggregation();

  Backends backends;
  std::shared_ptr<Connection> connection;
  {
    MonitorLock lock(_sessionDelegate.monitor());
    _sessionInfo.reset();
    _hierarchyDictionary.reset();
    std::swap(_backends, backends);
    connection = std::move(_connection);
  }
  _userInfo.reset();
  _frameworks = nullptr;
  for (const auto& [key, backend] : backends) backend->cleanup();
  _periodicServices = Dictionary();
  _storebagVersion.reset();
  _digestKey.reset();
  // Requests that were started complete all the same.
  _connectivityHelper.reset();
  information_.clear();
  standing_.reset();
}

}  // namespace kyt
