#include "Statistics/Service/ZQReportingBlockThrottle.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <optional>
#include <string_view>
#include <tuple>
#include <utility>

#include "base/Format.h"
#include "base/Json.h"
#include "platform/Log.h"

namespace quarvel {

namespace {

using std::chrono::microseconds;

constexpr std::string_view kThrottleSeconds = "_throttle_seconds";
constexpr std::string_view kComparisonFieldBlacklist = "_comparison_field_blacklist";
constexpr std::string_view kVolume = "Volume";
constexpr std::string_view kVolumeOperationTime = "VolumeOperationTime";

/// Keys whose values never make two messages different.
constexpr std::array<std::string_view, 5> kNeverCompared = {
    "systemuptime_sec", "processuptime_ms", "zqreporting_timestamp", kComparisonFieldBlacklist,
    kThrottleSeconds};
/// Stands in the message key for a value that is not compared.
constexpr char kExcludedMark = '^';
constexpr char kSeparator = '|';

constexpr double kDefaultDelaySeconds = 0.5;
constexpr double kDelayLimitSeconds = 5.0;
constexpr std::chrono::milliseconds kWorkerPause(100);
constexpr std::chrono::milliseconds kCompletionPause(500);
constexpr unsigned kCompletionPauses = 10;
constexpr unsigned kCompletionSeconds = 5;
constexpr std::chrono::duration<double> kLongestTimer = std::chrono::hours(24 * 365);

/// The scope of the sessions, whose messages the throttle sends.
LogHandle Scope() {
  static const LogHandle scope = ZQLogRegister(FourCharacterCode("zqrr"), "zqrr", kSubsystem,
                                               "reporting_session_verbose", 1, 31);
  return scope;
}

microseconds TimerSpan(double seconds) {
  if (!(seconds > 0)) return microseconds::zero();  // NaN too
  return std::chrono::round<microseconds>(
      std::min(std::chrono::duration<double>(seconds), kLongestTimer));
}

/// A key, or an entry in a list of keys, as text; none when it cannot be a key.
std::optional<std::string> KeyText(PayloadValue key) {
  if (const auto text = key.string()) return std::string(*text);
  if (const auto number = key.integer()) return fmt::to_string(*number);
  if (const auto number = key.unsignedInteger()) return fmt::to_string(*number);
  return std::nullopt;
}

/// The keys of one payload whose values are not compared.
class ExcludedKeys {
 public:
  explicit ExcludedKeys(const Payload& payload)
      : ignoresVolume_(payload.find(kVolume) && payload.find(kVolumeOperationTime)) {
    const auto listed = payload.find(kComparisonFieldBlacklist);
    if (!listed) return;
    for (const PayloadValue entry : listed->items()) {
      if (auto key = KeyText(entry)) listed_.push_back(*std::move(key));
    }
    std::ranges::sort(listed_);
  }

  [[nodiscard]] bool contain(std::string_view key) const {
    return std::ranges::find(kNeverCompared, key) != kNeverCompared.end() ||
           (ignoresVolume_ && (key == kVolume || key == kVolumeOperationTime)) ||
           std::ranges::binary_search(listed_, key);
  }

 private:
  bool ignoresVolume_;
  std::vector<std::string> listed_;  // sorted
};

struct SortedEntry {
  std::string key;
  bool isNumber;  // the key: 1 and "1" have the same text
  PayloadValue value;
};

std::vector<SortedEntry> SortedEntries(PayloadValue dictionary) {
  std::vector<SortedEntry> entries;
  entries.reserve(dictionary.count());
  for (const PayloadEntry& entry : dictionary.entries()) {
    entries.push_back(
        {KeyText(entry.key).value_or(""), !entry.key.string().has_value(), entry.value});
  }
  std::ranges::sort(entries, [](const SortedEntry& a, const SortedEntry& b) {
    return std::tie(a.key, a.isNumber) < std::tie(b.key, b.isNumber);
  });
  return entries;
}

/// Compact JSON with the keys of every dictionary sorted, so that equal values have equal texts.
void AppendSortedJson(std::string& out, PayloadValue value) {
  char separator = '\0';
  const auto separate = [&] {
    if (separator != '\0') out += separator;
    separator = ',';
  };
  if (value.kind() == Value::Kind::list) {
    out += '[';
    for (const PayloadValue item : value.items()) {
      separate();
      AppendSortedJson(out, item);
    }
    out += ']';
  } else if (value.kind() == Value::Kind::dictionary) {
    out += '{';
    for (const SortedEntry& entry : SortedEntries(value)) {
      separate();
      AppendJson(out, Value(entry.key));
      out += ':';
      AppendSortedJson(out, entry.value);
    }
    out += '}';
  } else {
    AppendJson(out, value);
  }
}

/// Booleans are numbers here.
std::optional<double> NumberOf(PayloadValue value) {
  if (const auto boolean = value.boolean()) return *boolean ? 1.0 : 0.0;
  if (const auto number = value.integer()) return static_cast<double>(*number);
  if (const auto number = value.unsignedInteger()) return static_cast<double>(*number);
  return value.real();
}

}  // namespace

ZQReportingBlockThrottleTimerWrapper::ZQReportingBlockThrottleTimerWrapper(Block block)
    : block_(std::make_shared<Block>(std::move(block))) {}

std::shared_ptr<Block> ZQReportingBlockThrottleTimerWrapper::block() const {
  const MutexLock lock(mutex_);
  return block_;
}

void ZQReportingBlockThrottleTimerWrapper::setBlock(Block block) {
  auto newest = std::make_shared<Block>(std::move(block));
  {
    const MutexLock lock(mutex_);
    block_.swap(newest);
  }
  // The old block is destroyed outside the lock: it owns foreign objects.
}

std::shared_ptr<RunLoopTimer> ZQReportingBlockThrottleTimerWrapper::timer() const {
  const MutexLock lock(mutex_);
  return timer_;
}

void ZQReportingBlockThrottleTimerWrapper::setTimer(std::shared_ptr<RunLoopTimer> timer) {
  const MutexLock lock(mutex_);
  timer_.swap(timer);
}

void ZQReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  if (const auto timer = this->timer()) timer->fireAfter(TimerSpan(seconds));
}

std::shared_ptr<ZQReportingBlockThrottle> ZQReportingBlockThrottle::init() {
  auto throttle = std::make_shared<ZQReportingBlockThrottle>(Private{});
  const std::shared_ptr<WorkerThread> thread =
      CreateWorkerThread("tarnwick.quarvel.block.throttle", [throttle] { throttle->work(); });
  throttle->setQueueThread(thread);
  thread->start();
  return throttle;
}

ZQReportingBlockThrottle::ZQReportingBlockThrottle(Private) {}

std::string ZQReportingBlockThrottle::buildMessageKey(const Payload& payload, ReporterID reporterID,
                                                      std::uint32_t category, std::uint32_t type) {
  const ExcludedKeys excluded(payload);
  std::string messageKey;
  for (const SortedEntry& entry : SortedEntries(payload.root())) {
    messageKey += entry.key;
    messageKey += kSeparator;
    if (excluded.contain(entry.key)) {
      messageKey += kExcludedMark;
    } else if (const auto text = entry.value.string()) {
      messageKey += *text;
    } else {
      AppendSortedJson(messageKey, entry.value);
    }
    messageKey += kSeparator;
  }
  return messageKey + fmt::format("reporterID{0}{1}{0}{2}{0}{3}", kSeparator, reporterID,
                                  ZQReportingUtilityCategoryName(category),
                                  ZQReportingUtilityTypeName(type));
}

double ZQReportingBlockThrottle::determineSleepTime(const Payload& payload) {
  ZQ_FUNCTION("+[ZQReportingBlockThrottle determineSleepTime:]");
  const auto value = payload.find(kThrottleSeconds);
  if (!value) return kDefaultDelaySeconds;
  const auto seconds = NumberOf(*value);
  if (!seconds) {
    // The word XoNumber is deliberate.
    ZQ_LOG(Scope(), info, "Rejecting non XoNumber value of throttle time. {{time={}}}",
           Described(value->toValue()));
    return kDefaultDelaySeconds;
  }
  if (*seconds >= kDelayLimitSeconds) {
    ZQ_LOG(Scope(), info, "Rejecting large throttle time. {{time={}, max={:f}}}",
           Described(value->toValue()), kDelayLimitSeconds);
    return kDefaultDelaySeconds;
  }
  return static_cast<double>(static_cast<float>(*seconds));
}

void ZQReportingBlockThrottle::addMessageBlock(Block block, ReporterID reporterID,
                                               const Payload& message, std::uint32_t category,
                                               std::uint32_t type) {
  ZQ_FUNCTION("-[ZQReportingBlockThrottle addMessageBlock:reporterID:message:category:type:]");
  const std::string key = buildMessageKey(message, reporterID, category, type);
  const double seconds = determineSleepTime(message);
  std::shared_ptr<Wrapper> duplicate;
  {
    // Lookup and insertion under one lock: of two callers with equal messages, the second finds the
    // first one's.
    const MutexLock lock(timersMutex_);
    if (const auto pending = timersInFlight_.find(key); pending != timersInFlight_.end()) {
      duplicate = pending->second;
    } else {
      timersInFlight_.emplace(key, makeWrapper(key, std::move(block), seconds));
    }
  }
  if (duplicate) {
    ZQ_LOG(Scope(), debug, "Dropping duplicate message for {}", key);
    duplicate->sleepFor(seconds);
    duplicate->setBlock(std::move(block));  // NOLINT(bugprone-use-after-move): not moved above
    return;
  }
  const MutexLock lock(unscheduledMutex_);
  unscheduledTimerKeys_.push_back(key);
}

std::shared_ptr<ZQReportingBlockThrottle::Wrapper> ZQReportingBlockThrottle::makeWrapper(
    const std::string& key, Block block, double seconds) {
  auto wrapper = std::make_shared<Wrapper>(std::move(block));
  // The wrapper owns the timer, so the timer must not own the wrapper. It fires on the worker,
  // which owns the throttle.
  wrapper->setTimer(CreateRunLoopTimer(TimerSpan(seconds),
                                       [this, pending = std::weak_ptr<Wrapper>(wrapper), key] {
                                         if (const auto due = pending.lock()) fire(*due, key);
                                       }));
  return wrapper;
}

void ZQReportingBlockThrottle::fire(Wrapper& wrapper, const std::string& key) {
  const std::shared_ptr<Block> block = wrapper.block();
  std::shared_ptr<Wrapper> fired;
  {
    const MutexLock lock(timersMutex_);
    if (const auto pending = timersInFlight_.find(key); pending != timersInFlight_.end()) {
      fired = std::move(pending->second);
      timersInFlight_.erase(pending);
      if (const auto timer = fired->timer()) timer->invalidate();
    }
  }
  if (*block) (*block)();
}

void ZQReportingBlockThrottle::work() {
  ZQ_FUNCTION("-[ZQReportingBlockThrottle init]");
  while (shouldKeepRunning_) {
    if (countUnscheduled() > 0) {
      ZQ_LOG(Scope(), debug, "calling workingRunLoop run from inside thread block");
      scheduleTimers();
      RunLoop::current().run();
    }
    ZQ_LOG(Scope(), debug, "sleeping in thread");
    SleepThread(kWorkerPause);
  }
}

void ZQReportingBlockThrottle::scheduleTimers() {
  const MutexLock lock(unscheduledMutex_);
  for (const std::string& key : unscheduledTimerKeys_) {
    std::shared_ptr<RunLoopTimer> timer;
    {
      const MutexLock timersLock(timersMutex_);
      if (const auto pending = timersInFlight_.find(key); pending != timersInFlight_.end()) {
        timer = pending->second->timer();
      }
    }
    if (timer) RunLoop::current().addTimer(timer);
  }
  unscheduledTimerKeys_.clear();
}

void ZQReportingBlockThrottle::waitForCompletion() {
  ZQ_FUNCTION("-[ZQReportingBlockThrottle waitForCompletion]");
  ZQ_LOG(Scope(), info, "waitForCompletion. timersInFlight={} unscheduledTimerKeys={}",
         countInFlight(), countUnscheduled());
  if (countInFlight() == 0) return;
  ZQ_LOG(Scope(), debug, "Waiting up to {} seconds for blockThrottle queue to be empty.",
         kCompletionSeconds);
  for (unsigned pauses = 0; pauses < kCompletionPauses; ++pauses) {
    if (countInFlight() == 0) return;
    SleepThread(kCompletionPause);
  }
  if (const std::size_t left = countInFlight(); left > 0) {
    ZQ_LOG(Scope(), standard,
           "Giving up on waiting for completion after {} seconds. timersInFlight={}",
           kCompletionSeconds, left);
  }
}

std::size_t ZQReportingBlockThrottle::countInFlight() const {
  const MutexLock lock(timersMutex_);
  return timersInFlight_.size();
}

std::size_t ZQReportingBlockThrottle::countUnscheduled() const {
  const MutexLock lock(unscheduledMutex_);
  return unscheduledTimerKeys_.size();
}

ZQReportingBlockThrottle::TimersInFlight ZQReportingBlockThrottle::timersInFlight() const {
  const MutexLock lock(timersMutex_);
  return timersInFlight_;
}

void ZQReportingBlockThrottle::setTimersInFlight(TimersInFlight timersInFlight) {
  const MutexLock lock(timersMutex_);
  timersInFlight_.swap(timersInFlight);
}

ZQReportingBlockThrottle::TimerKeys ZQReportingBlockThrottle::unscheduledTimerKeys() const {
  const MutexLock lock(unscheduledMutex_);
  return unscheduledTimerKeys_;
}

void ZQReportingBlockThrottle::setUnscheduledTimerKeys(TimerKeys keys) {
  const MutexLock lock(unscheduledMutex_);
  unscheduledTimerKeys_.swap(keys);
}

std::shared_ptr<WorkerThread> ZQReportingBlockThrottle::queueThread() const {
  const MutexLock lock(threadMutex_);
  return queueThread_;
}

void ZQReportingBlockThrottle::setQueueThread(std::shared_ptr<WorkerThread> thread) {
  const MutexLock lock(threadMutex_);
  queueThread_.swap(thread);
}

}  // namespace quarvel
