#include "Statistics/Service/ZQReportingServiceDelegate.h"

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <functional>
#include <utility>

#include "Statistics/ZQReportingOhmrikUtility.h"
#include "Statistics/ZQReportingUtility.h"
#include "base/Format.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/Preferences.h"
#include "platform/Process.h"
#include "platform/Trace.h"
#include "platform/Vistrel.h"

namespace quarvel {

namespace {

constexpr std::uint32_t kTraceCreate = 0x21042814;
constexpr std::uint32_t kTraceStart = 0x21042818;
constexpr std::uint32_t kTraceStop = 0x2104281c;
constexpr std::uint32_t kTraceDestroy = 0x21042820;
constexpr std::uint32_t kTraceSendMessage = 0x21042824;

constexpr int kKilledStatus = 2;

/// A message to this many sessions is routed in microseconds; a list may name a hundred thousand.
constexpr std::size_t kFewTargets = 8;

constexpr const char* kDefaultsNotification = "tarnwick.quarvel.reporting";
constexpr const char* kDeviceName = "device_name";
constexpr const char* kDisableReporting = "disable_reporting";
constexpr const char* kClientUptimeEvent = "tarnwick.quarvel.zqreportingclientuptime";

/// The scope "zqrs", registered by the delegate's construction; the default log before.
std::atomic<LogHandle> serverScope{nullptr};
LogHandle Scope() {
  return serverScope.load(std::memory_order_relaxed);
}

List ReporterIDList(const std::vector<ReporterID>& reporterIDs) {
  return {reporterIDs.begin(), reporterIDs.end()};
}

/// The list of the sessions' descriptions for a log line. Composed without intermediate values: a
/// client may have a hundred thousand sessions, and every broadcast prints them all.
template <class Sessions, class Projection>
std::string SessionDescriptions(const Sessions& sessions, Projection reporterID) {
  std::string text = "[";
  text.reserve(64 * sessions.size());
  for (const auto& session : sessions) {
    text += text.size() == 1 ? "\"" : ",\"";
    ZQReportingSession::appendDescription(text, std::invoke(reporterID, session));
    text += '"';
  }
  return text += ']';
}

std::string SessionDescriptions(const std::vector<ZQReportingSession*>& sessions) {
  return SessionDescriptions(sessions, &ZQReportingSession::reporterID);
}

std::string SessionDescriptions(const ZQReportingServerInstance::SessionMap& sessions) {
  return SessionDescriptions(sessions, &ZQReportingServerInstance::SessionMap::value_type::first);
}

/// Reports how long a client was connected. `instance` is null when it is already destroyed.
void ReportClientUptime(const ZQReportingServerInstance* instance, std::int32_t pid) {
  ZQ_FUNCTION("-[ZQReportingServiceDelegate listener:shouldAcceptNewConnection:]");
  const Date now = CurrentDate();
  const auto startDate = instance == nullptr ? std::nullopt : instance->clientStartDate();
  const auto processName = instance == nullptr ? std::nullopt : instance->clientProcessName();
  const std::string displayName = processName.value_or("unknown");
  Value uptime(-1);
  int wholeSeconds = -1;
  if (!startDate) {
    ZQ_LOG(Scope(), standard, "clientStartDate is nil. clientpid={} clientprocessname={}", pid,
           displayName);
  } else {
    const auto seconds =
        std::chrono::duration<double>(std::max(now, *startDate) - std::min(now, *startDate));
    uptime = seconds.count();
    wholeSeconds = static_cast<int>(std::min(seconds.count(), double{INT32_MAX}));
    if (*startDate > now) {
      // The text says "past" for a date in the future; this is deliberate.
      ZQ_LOG(Scope(), standard, "clientStartDate is in the past. clientpid={} clientprocessname={}",
             pid, displayName);
    }
  }
  ZQ_LOG(Scope(), standard, "InvalidationHandler: connection exited process={} uptime_sec={}",
         Described(processName), wholeSeconds);
  if (!processName) {
    ZQ_LOG(Scope(), standard, "clientProcessName is nil. clientpid={}", pid);
    return;
  }
  VistrelSendEventLazy(kClientUptimeEvent, [&processName, &uptime] {
    return Payload(Dictionary{{"processName", *processName}, {"seconds", uptime}});
  });
}

}  // namespace

std::optional<std::string> ProcessNameForPID(std::int32_t pid) {
  if (pid == OwnProcessIdentifier()) return OwnProcessName();
  if (pid >= 1) return ProcessCommandName(pid);
  return std::nullopt;
}

// The delegate.

std::shared_ptr<ZQReportingServiceDelegate> ZQReportingServiceDelegate::create() {
  serverScope = ZQLogRegister(FourCharacterCode("zqrs"), "zqrs", kSubsystem,
                              "reporting_server_verbose", 1, 31);
  auto delegate = std::make_shared<ZQReportingServiceDelegate>(Private{});
  delegate->listenForDefaultsNotification();
  delegate->driverUtility_.emplace();
  return delegate;
}

ZQReportingServiceDelegate::ZQReportingServiceDelegate(Private) {
  SetServerQueue(
      CreateSerialQueue("tarnwick.quarvel.reporting.server", QualityOfService::userInteractive));
}

Dictionary ZQReportingServiceDelegate::ZQReportingDefaults() {
  const PreferencesDomain domain = OpenPreferencesDomain(kSubsystem);
  Dictionary defaults;
  if (domain.hasValue(kDeviceName)) {
    if (auto name = domain.string(kDeviceName)) defaults.set(kDeviceName, std::move(*name));
  }
  if (domain.hasValue(kDisableReporting)) {
    defaults.set(kDisableReporting, domain.boolean(kDisableReporting));
  } else {
    defaults.set(kDisableReporting, 0);
  }
  return defaults;
}

void ZQReportingServiceDelegate::listenForDefaultsNotification() {
  ZQ_FUNCTION("-[ZQReportingServiceDelegate listenForDefaultsNotification]");
  const std::int32_t status =
      RegisterForNotification(kDefaultsNotification, defaultsToken_, ServerQueue(),
                              [self = shared_from_this()](NotificationToken token) {
                                AssertOnServerQueue();
                                self->readDefaults(token);
                              });
  ZQ_LOG(Scope(), standard, "notify setup result {}", status);
}

void ZQReportingServiceDelegate::readDefaults(NotificationToken token) {
  ZQ_FUNCTION("-[ZQReportingServiceDelegate listenForDefaultsNotification]");
  if (token != defaultsToken_) return;
  ZQ_LOG(Scope(), standard, "re-reading quarvel defaults");
  defaults_ = ZQReportingDefaults();
  ZQ_LOG(Scope(), info, "defaults {}", Described(defaults_));
  for (const auto& client : clients_) {
    for (const auto& [reporterID, session] : client->clientReportingSessionMap()) {
      session->updateDefaults(defaults_);
    }
  }
  if (const Value* disabled = defaults_->find(kDisableReporting)) {
    reportingEnabled_ = *disabled != Value(true);
  }
}

bool ZQReportingServiceDelegate::shouldAcceptNewConnection(
    ServiceListener& /*listener*/, const std::shared_ptr<ClientConnection>& connection) {
  ZQ_FUNCTION("-[ZQReportingServiceDelegate listener:shouldAcceptNewConnection:]");
  const std::int32_t pid = connection->processIdentifier();
  ZQ_LOG(Scope(), standard, "newConnection: {}", connection->description());
  {
    const RecursiveMutexLock lock(lock_);
    connection->setExportedInterface(ZQReportingServiceProtocolInterface());
    connection->setExportedObject(ZQReportingServerInstance::initWithPID(pid, shared_from_this()));
  }
  // Only the connection and the client list own the instance, so the handlers hold it weakly.
  const std::weak_ptr<ZQReportingServerInstance> weakInstance =
      std::static_pointer_cast<ZQReportingServerInstance>(connection->exportedObject());

  ServerQueue().async([self = shared_from_this(), weakInstance, pid] {
    AssertOnServerQueue();
    const auto instance = weakInstance.lock();
    if (instance == nullptr) return;  // the connection has already ended
    self->clients_.push_back(instance);
    instance->setClientStartDate(CurrentDate());
    instance->setClientProcessName(ProcessNameForPID(pid));
  });
  connection->setInterruptionHandler([weakInstance] {
    ZQ_LOG(Scope(), standard, "InterruptionHandler: connection exited");
    if (const auto instance = weakInstance.lock()) instance->handleConnectionError();
  });
  connection->setInvalidationHandler([weakInstance, pid] {
    const auto instance = weakInstance.lock();
    if (instance != nullptr) instance->handleConnectionError();
    ReportClientUptime(instance.get(), pid);
  });
  connection->resume();
  return true;
}

std::shared_ptr<ZQReportingSession> ZQReportingServiceDelegate::findReportingSessionForID(
    ReporterID reporterID) {
  ZQ_FUNCTION("-[ZQReportingServiceDelegate findReportingSessionForID:]");
  const RecursiveMutexLock lock(lock_);
  if (reporterID == 0 || !reportingEnabled_) return nullptr;
  for (const auto& client : clients_) {
    const auto& sessions = client->clientReportingSessionMap();
    if (const auto found = sessions.find(reporterID); found != sessions.end()) {
      ZQ_LOG(Scope(), info, "found reporting session {} for client {}", reporterID,
             client->processIdentifier());
      return found->second;
    }
  }
  ZQ_LOG(Scope(), error, "failed to find reporting session {}", reporterID);
  return nullptr;
}

void ZQReportingServiceDelegate::removeClient(const ZQReportingServerInstance& client) {
  std::erase_if(clients_, [&client](const auto& each) { return each.get() == &client; });
}

// The server instance.

std::shared_ptr<ZQReportingServerInstance> ZQReportingServerInstance::initWithPID(
    std::int32_t pid, std::weak_ptr<ZQReportingServiceDelegateProtocol> delegate) {
  ZQ_FUNCTION("-[ZQReportingServerInstance initWithPID:delegate:]");
  ZQ_LOG(Scope(), standard, "new client with pid {}", static_cast<std::uint64_t>(pid));
  return std::make_shared<ZQReportingServerInstance>(Private{}, pid, std::move(delegate));
}

ZQReportingServerInstance::ZQReportingServerInstance(
    Private, std::int32_t pid, std::weak_ptr<ZQReportingServiceDelegateProtocol> delegate)
    : processIdentifier_(pid), delegate_(std::move(delegate)) {}

ZQReportingServerInstance::~ZQReportingServerInstance() {
  ZQ_FUNCTION("-[ZQReportingServerInstance dealloc]");
  ZQ_LOG(Scope(), standard, "dealloc {} from the server client list", processIdentifier_);
}

std::optional<Date> ZQReportingServerInstance::clientStartDate() const {
  const MutexLock lock(clientMutex_);
  return clientStartDate_;
}

void ZQReportingServerInstance::setClientStartDate(Date date) {
  const MutexLock lock(clientMutex_);
  clientStartDate_ = date;
}

std::optional<std::string> ZQReportingServerInstance::clientProcessName() const {
  const MutexLock lock(clientMutex_);
  return clientProcessName_;
}

void ZQReportingServerInstance::setClientProcessName(std::optional<std::string> name) {
  const MutexLock lock(clientMutex_);
  clientProcessName_ = std::move(name);
}

std::shared_ptr<ZQReportingSession> ZQReportingServerInstance::findReportingSessionForID(
    ReporterID reporterID, bool acrossAllClients) {
  const auto own = clientReportingSessionMap_.find(reporterID);
  if (own != clientReportingSessionMap_.end()) return own->second;
  if (!acrossAllClients) return nullptr;
  const auto delegate = delegate_.lock();
  return delegate == nullptr ? nullptr : delegate->findReportingSessionForID(reporterID);
}

void ZQReportingServerInstance::createReportingSession(ReporterID reporterID, BoolReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance createReportingSession:reply:]");
  ZQ_LOG(Scope(), debug, "creating session for reporter {}", reporterID);
  ServerQueue().async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    AssertOnServerQueue();
    EmitKernelTrace(kTraceCreate);
    self->clientReportingSessionMap_.insert_or_assign(
        reporterID, ZQReportingSession::initWithID(reporterID, {self->processIdentifier_}));
    ZQ_LOG(Scope(), standard, "session created for reporter {}", reporterID);
    reply(true);
  });
}

void ZQReportingServerInstance::setServiceType(std::uint16_t serviceType,
                                               ReporterID reportingSession, BoolReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance setServiceType:reportingSession:reply:]");
  ZQ_LOG(Scope(), debug, "setting service type {} for reporter {}", serviceType, reportingSession);
  ServerQueue().async([self = shared_from_this(), serviceType, reporterID = reportingSession,
                       reply = std::move(reply)] {
    AssertOnServerQueue();
    if (reporterID == 0) return reply(true);
    if (const auto session = self->findReportingSessionForID(reporterID, false)) {
      session->setServiceType(serviceType);
      // The two blanks here and below are deliberate.
      ZQ_LOG(Scope(), standard, "service type {} set for reporter  {}", serviceType, reporterID);
    }
    reply(true);
  });
}

void ZQReportingServerInstance::getServiceNameForReporterID(ReporterID reporterID,
                                                            ServiceTypeReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance getServiceNameForReporterID:reply:]");
  ZQ_LOG(Scope(), debug, "fetching seviceType");  // misspelt deliberately
  ServerQueue().async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    AssertOnServerQueue();
    // Identifier 0 is answered here and then looked up, which answers a second time.
    if (reporterID == 0) reply(kServiceTypeUnknown);
    const auto session = self->findReportingSessionForID(reporterID, true);
    const std::uint16_t serviceType =
        session == nullptr ? kServiceTypeUnknown : session->serviceType();
    reply(serviceType);
    ZQ_LOG(Scope(), standard, "returnning service type {} for reporter  {}", serviceType,
           reporterID);  // misspelt deliberately
  });
}

void ZQReportingServerInstance::setConfiguration(std::optional<Dictionary> configuration,
                                                 ReporterID reporterID, BoolReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance setConfiguration:forReporterID:reply:]");
  ZQ_LOG(Scope(), debug, "setting configuration");
  ServerQueue().async([self = shared_from_this(), configuration = std::move(configuration),
                       reporterID, reply = std::move(reply)] {
    AssertOnServerQueue();
    if (const auto session = self->findReportingSessionForID(reporterID, false)) {
      session->setConfiguration(configuration);
    }
    reply(true);
  });
}

void ZQReportingServerInstance::startReportingSessionForID(ReporterID reporterID, BoolReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance startReportingSessionForID:reply:]");
  ZQ_LOG(Scope(), debug, "starting session for reporter {}", reporterID);
  ServerQueue().async([self = shared_from_this(), reporterID, reply = std::move(reply)]() mutable {
    AssertOnServerQueue();
    EmitKernelTrace(kTraceStart);
    if (reporterID == 0) return reply(true);
    const auto session = self->findReportingSessionForID(reporterID, true);
    if (session == nullptr || session->started()) return;
    session->start();
    if (const auto delegate = self->delegate_.lock()) {
      session->setDriverSnapShot(delegate->getSnapShot());
    }
    session->transactionCompleteBlock()(true);
    session->setTransactionCompleteBlock(std::move(reply));
  });
}

void ZQReportingServerInstance::stopReportingSessionForID(ReporterID reporterID, BoolReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance stopReportingSessionForID:reply:]");
  ZQ_LOG(Scope(), debug, "stopping session for reporter {}", reporterID);
  ServerQueue().async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    AssertOnServerQueue();
    EmitKernelTrace(kTraceStop);
    if (reporterID == 0) return reply(true);
    if (const auto session = self->findReportingSessionForID(reporterID, false)) {
      self->reportDriverStatistics(*session);
      session->setDriverSnapShot(std::nullopt);
      session->stop();
    }
    ZQ_LOG(Scope(), standard, "stopping {}", reporterID);
    reply(true);
  });
}

void ZQReportingServerInstance::reportDriverStatistics(ZQReportingSession& session) {
  ZQ_FUNCTION("-[ZQReportingServerInstance stopReportingSessionForID:reply:]");
  const auto delegate = delegate_.lock();
  const auto statistics =
      delegate == nullptr
          ? std::nullopt
          : delegate->getDriverStatisticsRelativeToSnapShot(session.driverSnapShot());
  if (statistics) {
    session.sendMessage(Payload(*statistics), kCategoryTallixing, kTypeGeneric, nullptr);
    ZQ_LOG(Scope(), standard, "fetching driver logs {}", Described(*statistics));
  } else {
    ZQ_LOG(Scope(), standard, "nothing interesting to fetch from the drivers");
  }
}

void ZQReportingServerInstance::destroyReportingSession(ReporterID reporterID, BoolReply reply) {
  ZQ_FUNCTION("-[ZQReportingServerInstance destroyReportingSession:reply:]");
  ZQ_LOG(Scope(), debug, "destroying session for reporter {}", reporterID);
  ServerQueue().async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    AssertOnServerQueue();
    EmitKernelTrace(kTraceDestroy);
    if (reporterID == 0) return reply(true);
    if (const auto session = self->findReportingSessionForID(reporterID, false)) {
      if (session->started()) session->stop();
      self->clientReportingSessionMap_.erase(reporterID);
    }
    ZQ_LOG(Scope(), standard, "destroying {}", reporterID);
    reply(true);
  });
}

void ZQReportingServerInstance::reporterID(ReporterID reporterID, DictionaryReply valid) {
  ZQ_FUNCTION("-[ZQReportingServerInstance reporterID:valid:]");
  ZQ_LOG(Scope(), debug, "validating reporter {}", reporterID);
  ServerQueue().asyncBrief([self = shared_from_this(), reporterID, valid = std::move(valid)] {
    AssertOnServerQueue();
    Dictionary validity = {{"reporterID", 0}, {"serviceType", kServiceTypeUnknown}};
    if (const auto session = self->findReportingSessionForID(reporterID, true)) {
      validity = {{"reporterID", reporterID}, {"serviceType", session->serviceType()}};
    }
    ZQ_LOG(Scope(), standard, "validating reporter {}", reporterID);
    valid(std::move(validity));
  });
}

void ZQReportingServerInstance::getAllReporters(ListReply reply) {
  ServerQueue().async([self = shared_from_this(), reply = std::move(reply)] {
    AssertOnServerQueue();
    List reporterIDs;
    if (const auto delegate = self->delegate_.lock()) {
      for (const auto& client : delegate->getAllClients()) {
        for (const auto& [reporterID, session] : client->clientReportingSessionMap()) {
          reporterIDs.emplace_back(reporterID);
        }
      }
    }
    reply(std::move(reporterIDs));
  });
}

void ZQReportingServerInstance::killService(BoolReply /*reply*/) {
  ZQ_FUNCTION("-[ZQReportingServerInstance killService:]");
  ZQ_LOG(Scope(), standard, "DESTROYING SERVICE");
  ExitProcess(kKilledStatus);
}

void ZQReportingServerInstance::sendMessage(std::optional<Payload> payload, std::uint32_t category,
                                            std::uint16_t type,
                                            std::optional<std::vector<ReporterID>> reportingIDs,
                                            ErrorReply reply) {
  ZQ_FUNCTION(
      "-[ZQReportingServerInstance sendMessage:withCategory:andType:forReportingIDs:reply:]");
  ZQ_LOG(Scope(), debug, "sending message for reporter {}",
         reportingIDs ? Described(Value(ReporterIDList(*reportingIDs))) : kAbsentText);
  const bool isBrief = reportingIDs && reportingIDs->size() <= kFewTargets;
  Block route([self = shared_from_this(), payload = std::move(payload), category, type,
               reportingIDs = std::move(reportingIDs), reply = std::move(reply)] {
    AssertOnServerQueue();
    EmitKernelTrace(kTraceSendMessage);
    const auto delegate = self->delegate_.lock();
    if (delegate == nullptr || !delegate->isReportingEnabled()) {
      return reply(Error{"tarnwick.audio.reporting", 1, {}});
    }
    if (reportingIDs) {
      self->routeByIDs(payload, category, type, *reportingIDs);
    } else {
      self->broadcast(*delegate, payload, category, type);
    }
    reply(std::nullopt);
  });
  if (isBrief) {
    ServerQueue().asyncBrief(std::move(route));
  } else {
    ServerQueue().async(std::move(route));
  }
}

void ZQReportingServerInstance::routeByIDs(const std::optional<Payload>& payload,
                                           std::uint32_t category, std::uint16_t type,
                                           const std::vector<ReporterID>& reportingIDs) {
  for (const ReporterID reporterID : reportingIDs) {
    const auto session = reporterID == 0 ? nullptr : findReportingSessionForID(reporterID, true);
    if (session == nullptr) {
      CountAcceptedMessage();
      CountDroppedMessage(StoreDrop::noSuchSession);
      continue;
    }
    ZQReportingVistrelBridge::handleEvent(payload, category, type, session->userInfo());
    ZQReportingOhmrikUtility::handleEvent(payload, category, type, session->userInfo());
    session->sendMessage(payload, category, type, nullptr);
  }
}

void ZQReportingServerInstance::broadcast(ZQReportingServiceDelegateProtocol& delegate,
                                          const std::optional<Payload>& payload,
                                          std::uint32_t category, std::uint16_t type) {
  ZQ_FUNCTION(
      "-[ZQReportingServerInstance sendMessage:withCategory:andType:forReportingIDs:reply:]");
  std::vector<ZQReportingSession*> active;  // owned by the clients' maps, which this queue guards
  for (const auto& client : delegate.getAllClients()) {
    const auto& sessions = client->clientReportingSessionMap();
    ZQ_LOG(Scope(), standard, "sessions for client {} : {}", client->processIdentifier(),
           SessionDescriptions(sessions));
    for (const auto& [reporterID, session] : sessions) {
      if (session->started()) active.push_back(session.get());
    }
  }
  ZQ_LOG(Scope(), standard, "active reporting sessions {} : {}", active.size(),
         SessionDescriptions(active));
  if (active.empty()) {
    ZQ_LOG(Scope(), standard, "no active reporting sessions found, sending as standalone");
    ZQReportingSession::sendSingleMessage(payload, category, type, kServiceTypeStandalone,
                                          delegate.getDefaults(), nullptr);
    return;
  }
  for (ZQReportingSession* const session : active) {
    // The session before the sinks; a message by identifier has the opposite order.
    session->sendMessage(payload, category, type, nullptr);
    ZQReportingVistrelBridge::handleEvent(payload, category, type, session->userInfo());
    ZQReportingOhmrikUtility::handleEvent(payload, category, type, session->userInfo());
  }
}

void ZQReportingServerInstance::handleConnectionError() {
  ZQ_FUNCTION("-[ZQReportingServerInstance handleConnectionError]");
  ServerQueue().async([self = shared_from_this()] {
    AssertOnServerQueue();
    const auto delegate = self->delegate_.lock();
    if (delegate == nullptr ||
        std::ranges::find(delegate->getAllClients(), self) == delegate->getAllClients().end()) {
      return;
    }
    for (const auto& [reporterID, session] : self->clientReportingSessionMap_) {
      if (session->started()) session->stop();
    }
    delegate->removeClient(*self);
    ZQ_LOG(Scope(), standard, "removing {} from the server client list", self->processIdentifier_);
  });
}

}  // namespace quarvel
