#include "Statistics/Service/ZQReportingSession.h"

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <deque>
#include <unordered_map>
#include <utility>

#include "base/Format.h"
#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Utf8.h"
#include "platform/Clock.h"
#include "platform/Condition.h"
#include "platform/DeviceProperties.h"
#include "platform/FileSystem.h"
#include "platform/Log.h"
#include "platform/Orientation.h"
#include "platform/Random.h"
#include "platform/Trace.h"

namespace quarvel {

namespace {

constexpr std::uint32_t kTraceCreated = 0x21042828;
constexpr std::uint32_t kTraceStarted = 0x2104282c;
constexpr std::uint32_t kTraceStopping = 0x21042830;
constexpr std::uint32_t kTraceDisposed = 0x21042834;
constexpr std::uint32_t kTraceMessageSent = 0x21042838;

constexpr int kClientType = 19;
constexpr double kClientVersion = 2.0;
constexpr double kBackendSeconds = 9.0;
constexpr std::uint32_t kLongestAlarmDelaySeconds = 59;

LogHandle Scope() {
  static const LogHandle scope = ZQLogRegister(FourCharacterCode("zqrr"), "zqrr", kSubsystem,
                                               "reporting_session_verbose", 1, 31);
  return scope;
}

/// Replaces blanks in the payload's own keys with underscores.
Payload EnrichPayload(const Payload& payload) {
  return payload.replacingInKeys(' ', '_');
}

/// The agent takes the low half of a category code.
std::uint16_t AgentCategory(std::uint32_t category) {
  return static_cast<std::uint16_t>(category & 0xffff);
}

constexpr const char* kDiagnosticsDirectory =
    "/private/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/Audio/Reporting";
constexpr std::uint32_t kDiagnosticsPermissions = 0777;
constexpr std::int64_t kDeviceClassWithoutOrientation = 6;
constexpr const char* kSummaryKey = "ZQ_Session_Summary_Event";

/// One orientation entry of the history.
Dictionary OrientationEntry(std::string_view mode, std::string_view orientation, double seconds) {
  return {{fmt::format("{}_orientation", mode), orientation},
          {fmt::format("{}_orientation_time", mode), seconds}};
}

/// Joins the texts of each key of a history, in the order in which the keys first occurred.
class SummaryText {
 public:
  void add(std::string key, std::string text) {
    if (const auto found = index_.find(key); found != index_.end()) {
      found->second->append(1, ',').append(text);
      return;
    }
    auto& [ownKey, ownText] = texts_.emplace_back(std::move(key), std::move(text));
    index_.emplace(ownKey, &ownText);
  }
  [[nodiscard]] Payload payload() const {
    std::string encoded;
    MessagePackWriter writer(encoded);
    writer.dictionary(texts_.size());
    for (const auto& [key, text] : texts_) {
      writer.string(key);
      writer.string(text);
    }
    return Payload::written(encoded);
  }

 private:
  std::deque<std::pair<std::string, std::string>> texts_;  // the index points to its elements
  std::unordered_map<std::string_view, std::string*> index_;
};

std::string KeyText(const Key& key) {
  if (const auto* text = key.string()) return *text;
  if (const auto* number = key.integer()) return fmt::to_string(*number);
  return fmt::to_string(*key.unsignedInteger());
}

Payload SummaryOf(const PayloadHistory& history, std::uint16_t serviceType) {
  SummaryText texts;
  texts.add(kSummaryKey, fmt::to_string(serviceType));
  history.forEach(
      [&texts](const MessageIdentity& identity, const Payload& payload) {
        texts.add(identity.text(), JsonText(payload));
      },
      [&texts](const Dictionary& dictionary) {
        for (const auto& [key, value] : dictionary) texts.add(KeyText(key), Described(value));
      });
  return texts.payload();
}

/// A client's text as part of a file name: without directory separators, and short enough that the
/// whole name stays below the 255 bytes of common file systems.
std::string FileNamePart(std::string text) {
  constexpr std::size_t kLongest = 128;
  text.resize(Utf8Prefix(text, kLongest).size());
  std::ranges::replace_if(
      text, [](char c) { return c == '/' || c == '\0'; }, '_');
  return text;
}

/// The agent set-up waits on this. Shared with the agent's completion, which may come after the
/// wait has ended.
struct BackendSearch {
  const std::shared_ptr<Condition> condition = CreateCondition();
  bool found QUARVEL_GUARDED_BY(*condition) = false;
};

void SendOneMessage(const Payload& payload, std::uint32_t category, std::uint16_t type,
                    std::uint16_t serviceType, const ZQReportingSession::SendReply& reply) {
  ZQ_FUNCTION("+[ZQReportingSession sendSingleMessage:category:type:serviceType:userInfo:reply:]");
  EmitKernelTrace(kTraceMessageSent);
  ZQ_LOG(Scope(), debug, "sending single message");
  const Dictionary sessionInfo = {{kRelmReportingSessionInfoClientType, kClientType},
                                  {kRelmReportingSessionInfoClientVersion, kClientVersion},
                                  {kRelmReportingSessionInfoSessionID, -1}};
  const Dictionary userInfo = {
      {kRelmReportingUserInfoClientName, kSubsystem},
      {kRelmReportingUserInfoServiceName, ZQReportingUtilityServiceTypeName(serviceType)}};
  const Outcome sent = RelmReporting::sendOneMessage(sessionInfo, userInfo, AgentCategory(category),
                                                     type, EnrichPayload(payload));
  if (sent) {
    ZQ_LOG(Scope(), debug, "message {} : category {} : type {}", Described(payload), category,
           type);
  } else {
    ZQ_LOG(Scope(), error, "sendOneMessageWithSessionInfo {}", sent.error().description());
  }
  if (reply) reply(sent ? std::nullopt : std::optional(sent.error()));
}

void QueueSingleMessage(Payload payload, std::uint32_t category, std::uint16_t type,
                        std::uint16_t serviceType, ZQReportingSession::SendReply reply) {
  ZQ_FUNCTION("+[ZQReportingSession sendSingleMessage:category:type:serviceType:userInfo:reply:]");
  const std::chrono::seconds delay(
      serviceType == kServiceTypeAlarms ? RandomBelow(kLongestAlarmDelaySeconds + 1) : 0);
  ZQ_LOG(Scope(), debug, "sending single message after delta {} for service {}", delay.count(),
         serviceType);
  BackgroundQueue().after(
      delay, [payload = std::move(payload), category, type, serviceType, reply = std::move(reply)] {
        SendOneMessage(payload, category, type, serviceType, reply);
      });
}

}  // namespace

std::shared_ptr<ZQReportingSession> ZQReportingSession::initWithID(
    ReporterID reporterID, std::vector<std::int32_t> processIdentifiers) {
  return std::make_shared<ZQReportingSession>(Private{}, reporterID, std::move(processIdentifiers));
}

ZQReportingSession::ZQReportingSession(Private, ReporterID reporterID,
                                       std::vector<std::int32_t> processIdentifiers)
    : reporterID_(reporterID),
      processIdentifiers_(std::move(processIdentifiers)),
      aggregatedPayloadData_(std::make_shared<PayloadHistory>()),
      relmReportingQueue_(
          CreateSerialQueue("tarnwick.quarvel.session.relmreporting", QualityOfService::utility)) {
  ZQ_FUNCTION("-[ZQReportingSession initWithID:processIdentifiers:]");
  ZQ_LOG(Scope(), info, "created reporting session for ID: {}", reporterID_);
  EmitKernelTrace(kTraceCreated);
}

ZQReportingSession::~ZQReportingSession() {
  ZQ_FUNCTION("-[ZQReportingSession dealloc]");
  EmitKernelTrace(kTraceDisposed);
  ZQ_LOG(Scope(), info, "deallocing this session {}", reporterID_);
}

void ZQReportingSession::appendDescription(std::string& text, ReporterID reporterID) {
  const fmt::format_int number(reporterID);
  text += "<ZQReportingSession ";
  text.append(number.data(), number.size());
  text += '>';
}

std::shared_ptr<PayloadHistory> ZQReportingSession::aggregatedPayloadData() const {
  const MutexLock lock(historyMutex_);
  return aggregatedPayloadData_;
}

void ZQReportingSession::setAggregatedPayloadData(std::shared_ptr<PayloadHistory> history) {
  {
    const MutexLock lock(historyMutex_);
    aggregatedPayloadData_.swap(history);
  }
  // The old history, perhaps large, is destroyed outside the lock.
}

void ZQReportingSession::setServiceType(std::uint16_t serviceType) {
  ZQ_FUNCTION("-[ZQReportingSession setServiceType:]");
  serviceType_ = serviceType;
  serviceName_ = ZQReportingUtilityServiceTypeName(serviceType);
  ZQ_LOG(Scope(), info, "setting service type {}", serviceName_);
}

void ZQReportingSession::setConfiguration(const std::optional<Dictionary>& configuration) {
  if (configuration) userInfo_->merge(*configuration);
}

void ZQReportingSession::updateDefaults(const std::optional<Dictionary>& defaults) {
  if (defaults) userInfo_->merge(*defaults);
}

void ZQReportingSession::start() {
  ZQ_FUNCTION("-[ZQReportingSession start]");
  ZQ_LOG(Scope(), debug, "starting session owned by {}", reporterID_);
  if (started_) {
    ZQ_LOG(Scope(), info, "{} is already started", reporterID_);
    return;
  }
  started_ = true;
  countedAsStarted_.emplace(Gauge::startedSessions);
  setAggregatedPayloadData(std::make_shared<PayloadHistory>());
  EmitKernelTrace(kTraceStarted);
  if (shouldReportOrientation()) registerOrientationHandlers();
  relmReportingQueue_->async([self = shared_from_this(), userInfo = userInfo_,
                              serviceName = serviceName_,
                              backendFound = relmReportingSessionStarted_.load()] {
    self->setUpAgent(*userInfo, serviceName, backendFound);
  });
}

void ZQReportingSession::setUpAgent(const SharedDictionary& userInfo,
                                    const std::string& serviceName, bool backendFound) {
  ZQ_FUNCTION("-[ZQReportingSession start]");
  relmReportingQueue_->assertCurrent();
  if (serviceType_ == kServiceTypeTest) return;
  relmReportingAgentToken_ = RelmReporting::newSecureHierarchyToken(std::nullopt);
  const Dictionary sessionInfo = {
      {kRelmReportingSessionInfoClientType, kClientType},
      {kRelmReportingSessionInfoClientVersion, kClientVersion},
      {kRelmReportingSessionInfoSessionID, reporterID_},
      {kRelmReportingSessionInfoBatchEvent, true},
      {kRelmReportingSessionInfoHierarchyToken, *relmReportingAgentToken_}};
  Dictionary agentUserInfo = {{kRelmReportingUserInfoClientName, kSubsystem},
                              {kRelmReportingUserInfoServiceName, serviceName + "_session"}};
  agentUserInfo.merge(userInfo.copy());
  relmReportingSession_ = RelmReporting::createAgentSession(sessionInfo, agentUserInfo, {});

  const auto search = std::make_shared<BackendSearch>();
  {
    const BasicMutexLock<Condition> lock(*search->condition);
    search->found = backendFound;
  }
  relmReportingSession_->startConfiguration(
      [search](const std::optional<std::vector<std::string>>& backends) {
        if (!backends) {
          ZQ_LOG(Scope(), error, "No backends found, this session won't get sent to the server");
          return;
        }
        ZQ_LOG(Scope(), standard, "List of backends {}",
               Described(Value(List(backends->begin(), backends->end()))));
        const BasicMutexLock<Condition> lock(*search->condition);
        search->found = true;
        search->condition->signal();
      });
  const LogHandle scope = Scope();
  if (!ZQReportingUtilityWait(*search->condition, &search->found,
                              "waiting for relmreportingd to find backends",
                              "failed to find backend", &scope, kBackendSeconds)) {
    relmReportingSession_ = nullptr;
    relmReportingSessionStarted_ = false;
  }
}

void ZQReportingSession::stop() {
  ZQ_FUNCTION("-[ZQReportingSession stop]");
  ZQ_LOG(Scope(), debug, "ending session {}", reporterID_);
  if (shouldReportOrientation() && orientationCallbackID_) unregisterOrientationHandlers();
  if (!started_) return;
  // The repetition is deliberate: the first line reports every call, this one a call that ends a
  // run.
  ZQ_LOG(Scope(), debug, "ending session {}", reporterID_);
  EmitKernelTrace(kTraceStopping);
  sendSummary();
  relmReportingQueue_->async([self = shared_from_this()] { self->endAgent(); });
  setAggregatedPayloadData(nullptr);
  started_ = false;
  countedAsStarted_.reset();
  transactionCompleteBlock_(true);
}

/// An internal build condenses the history here, on the `ServerQueue`, since its file is written
/// there. Any other build condenses it on the session's queue: a long history takes a second, in
/// which the `ServerQueue` would keep every client waiting.
void ZQReportingSession::sendSummary() {
  ZQ_FUNCTION("-[ZQReportingSession stop]");
  const auto history = aggregatedPayloadData();
  if (history == nullptr || history->empty()) return;
  if (ZQReportingUtilityIsInternalBuild()) {
    const Payload summary = *createSummaryEventForSession();
    ZQ_LOG(Scope(), standard, "sending summary event for reporter {}", reporterID_);
    sendMessage(summary, kCategorySummary, kTypeSummary, true, nullptr);
    return;
  }
  ZQ_LOG(Scope(), standard, "sending summary event for reporter {}", reporterID_);
  acceptMessage();
  (void)nextIdentity(kCategorySummary, kTypeSummary);
  EmitKernelTrace(kTraceMessageSent);
  relmReportingQueue_->async(
      [self = shared_from_this(), history, serviceType = serviceType_.load()] {
        const Payload summary = SummaryOf(*history, serviceType);
        self->deliver(EnrichPayload(summary), kCategorySummary, kTypeSummary, summary, true);
      });
}

bool ZQReportingSession::shouldReportOrientation() const {
  if (!ZQReportingUtilityIsInternalBuild()) return false;
  const std::uint16_t serviceType = serviceType_;
  if (serviceType != kServiceTypeLongFormAudio && serviceType != kServiceTypeTelephony)
    return false;
  return DevicePropertyInteger("DeviceClassNumber") != kDeviceClassWithoutOrientation;
}

void ZQReportingSession::registerOrientationHandlers() {
  ZQ_FUNCTION("-[ZQReportingSession start]_block_invoke");
  const std::string callbackID = fmt::format("ZQReportingService {}", reporterID_);
  const Date startDate = CurrentDate();
  const auto handler = [&](const char* mode) {
    return [self = shared_from_this(), mode, startDate, callbackID](Orientation orientation) {
      const std::string_view name = OrientationName(orientation);
      const double elapsed = std::chrono::duration<double>(CurrentDate() - startDate).count();
      const double seconds = std::round(std::abs(elapsed) * 1000) / 1000;
      ZQ_LOG(Scope(), debug,
             "Orientation handler callback mode={} orientation=\"{}\" app=\"{}\", time={}, "
             "id=\"{}\"",
             mode, name, Described(self->userInfo_->find(kHostApplicationDisplayID)), seconds,
             callbackID);
      if (const auto history = self->aggregatedPayloadData()) {
        history->append(OrientationEntry(mode, name, seconds));
      }
    };
  };
  RegisterDeviceOrientationHandler(callbackID, handler("device"));
  RegisterUIOrientationHandler(callbackID, handler("ui"));
  orientationCallbackID_ = callbackID;
}

void ZQReportingSession::unregisterOrientationHandlers() {
  UnregisterDeviceOrientationHandler(*orientationCallbackID_);
  UnregisterUIOrientationHandler(*orientationCallbackID_);
  orientationCallbackID_.reset();
}

std::optional<Payload> ZQReportingSession::createSummaryEventForSession() {
  const auto history = aggregatedPayloadData();
  if (history == nullptr || history->empty()) return std::nullopt;
  Payload summary = SummaryOf(*history, serviceType_);
  history->insertAtFront(userInfo_->copy());
  if (ZQReportingUtilityIsInternalBuild()) writeSummaryLogFile(*history);
  return summary;
}

void ZQReportingSession::writeSummaryLogFile(const PayloadHistory& history) const {
  ZQ_FUNCTION("-[ZQReportingSession createSummaryEventForSession]");
  PrettyJsonWriter writer;
  writer.beginList();
  history.forEach(
      [&writer](const MessageIdentity& identity, const Payload& payload) {
        writer.beginDictionary();
        writer.key(identity.text());
        writer.value(payload.root());
        writer.endDictionary();
      },
      [&writer](const Dictionary& dictionary) { writer.value(dictionary); });
  writer.endList();
  const Result<std::string> json = writer.finish();
  if (!json) {
    ZQ_LOG(Scope(), error, "dataWithJSONObject: {}", json.error().description());
  }
  const std::string directory = DiagnosticsPath(kDiagnosticsDirectory);
  if (const Outcome made = CreateDirectory(directory, kDiagnosticsPermissions); !made) {
    ZQ_LOG(Scope(), error, "can't create logging directory at {}: {}", directory,
           made.error().description());
  }
  const auto application = userInfo_->find(kHostApplicationDisplayID);
  const std::string path =
      fmt::format("{}/{}-{}-{}-{}.json", directory, LocalDateText(CurrentDate(), "%Y%m%d-%H%M%S%z"),
                  "quarvel", application ? FileNamePart(Described(*application)) : "unknown",
                  ZQReportingUtilityServiceTypeName(serviceType_));
  const Outcome written = WriteFileAtomically(path, json ? json.value() : std::string());
  if (!written) {
    ZQ_LOG(Scope(), error, "jsonOutput writeToURL: {}", written.error().description());
  }
}

void ZQReportingSession::endAgent() {
  ZQ_FUNCTION("-[ZQReportingSession stop]");
  relmReportingQueue_->assertCurrent();
  if (serviceType_ == kServiceTypeTest) return;
  if (relmReportingSession_ == nullptr) return;
  relmReportingSession_->flushMessages([](const std::optional<Error>& error) {
    if (error) ZQ_LOG(Scope(), error, "flush error {}", error->description());
  });
  relmReportingSession_ = nullptr;
}

std::string MessageIdentity::text() const {
  const CategoryNamePieces pieces = ZQReportingUtilityCategoryNamePieces(category);
  return fmt::format("{}{}_{}_{}", pieces.component, pieces.kind,
                     ZQReportingUtilityTypeNameText(type), number);
}

MessageIdentity ZQReportingSession::nextIdentity(std::uint32_t category, std::uint16_t type) {
  const CategoryNamePieces pieces = ZQReportingUtilityCategoryNamePieces(category);
  const MessageName name{pieces.component, pieces.kind, ZQReportingUtilityTypeNameText(type)};
  auto count =
      std::ranges::find(messageCounts_, name, &std::pair<MessageName, std::uint64_t>::first);
  if (count == messageCounts_.end()) count = messageCounts_.emplace(count, name, 0);
  return {++count->second, category, type};
}

std::string ZQReportingSession::messageIdForCategory(std::uint32_t category, std::uint16_t type) {
  return nextIdentity(category, type).text();
}

void ZQReportingSession::acceptMessage() const {
  ZQ_FUNCTION("-[ZQReportingSession sendMessage:category:type:sync:reply:]");
  ZQ_LOG(Scope(), debug, "sending message for session owned by {}", reporterID_);
  CountAcceptedMessage();
}

void ZQReportingSession::sendMessage(const std::optional<Payload>& payload, std::uint32_t category,
                                     std::uint16_t type, bool /*sync*/, const SendReply& reply) {
  acceptMessage();
  const Payload original = payload.value_or(Payload());
  const Payload enriched = EnrichPayload(original);
  const MessageIdentity identity = nextIdentity(category, type);
  if (const auto history = aggregatedPayloadData()) history->append(identity, enriched);
  EmitKernelTrace(kTraceMessageSent);
  relmReportingQueue_->asyncBrief(
      [self = shared_from_this(), enriched, category, type, original, wasStarted = started_] {
        self->deliver(enriched, category, type, original, wasStarted);
      });
  if (reply) reply(std::nullopt);
}

void ZQReportingSession::sendMessage(const std::optional<Payload>& payload, std::uint32_t category,
                                     std::uint16_t type, const SendReply& reply) {
  sendMessage(payload, category, type, false, reply);
}

void ZQReportingSession::deliver(const Payload& enriched, std::uint32_t category,
                                 std::uint16_t type, const Payload& original, bool wasStarted) {
  ZQ_FUNCTION("-[ZQReportingSession sendMessage:category:type:sync:reply:]");
  relmReportingQueue_->assertCurrent();
  if (!wasStarted) {
    ZQ_LOG(Scope(), debug, "session not started, will send as a single message");
    QueueSingleMessage(enriched, category, type, serviceType_, nullptr);
    return;
  }
  if (serviceType_ == kServiceTypeTest) {
    CountDroppedMessage(MessageDrop::testServiceType);
    ZQ_LOG(Scope(), info, "transactions aren't allowed on this platform");
    return;
  }
  if (relmReportingSession_ == nullptr) {
    CountDroppedMessage(MessageDrop::noAgentSession);
    ZQ_LOG(Scope(), error, "{}", "No valid RelmReportingSession");
    return;
  }
  // A refusal is deliberately silent; the message is in the session's history.
  if (relmReportingSession_->agentSendMessage(AgentCategory(category), type, enriched)) {
    ZQ_LOG(Scope(), debug, "RelmReportingAgent {} : message {} : category {} : type {}",
           relmReportingSession_->description(), Described(original), category, type);
  }
}

void ZQReportingSession::sendSingleMessage(const std::optional<Payload>& payload,
                                           std::uint32_t category, std::uint16_t type,
                                           std::uint16_t serviceType,
                                           const std::optional<Dictionary>& /*userInfo*/,
                                           SendReply reply) {
  CountAcceptedMessage();
  QueueSingleMessage(payload.value_or(Payload()), category, type, serviceType, std::move(reply));
}

}  // namespace quarvel
