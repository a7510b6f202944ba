#include "tests/simulated/Simulation.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdlib>

#include "platform/Clock.h"
#include "platform/DeviceProperties.h"
#include "platform/FileSystem.h"
#include "platform/Ohmrik.h"
#include "platform/Preferences.h"
#include "platform/Process.h"
#include "platform/Random.h"
#include "platform/Trace.h"
#include "platform/Vistrel.h"

namespace quarvel {

static Simulation* currentSimulation = nullptr;

Seeds::Seeds() {
  constexpr std::uint64_t kNightlyFactor = 25;
  if (const char* one = std::getenv("QUARVEL_SEED")) {
    first_ = last_ = std::strtoull(one, nullptr, 10);
  } else if (const char* count = std::getenv("QUARVEL_SEEDS")) {
    const std::uint64_t times = std::getenv("QUARVEL_NIGHTLY") == nullptr ? 1 : kNightlyFactor;
    last_ = std::strtoull(count, nullptr, 10) * times;
  }
}

std::vector<std::string> Journal::lines(std::initializer_list<std::string_view> prefixes) const {
  std::vector<std::string> matching;
  std::ranges::copy_if(*this, std::back_inserter(matching), [&](const std::string& line) {
    return std::ranges::any_of(prefixes, [&](auto prefix) { return line.starts_with(prefix); });
  });
  return matching;
}

Simulation::Simulation(std::uint64_t seed)
    : random{std::mt19937(seed)},
      scheduler(seed),
      seedTrace_(__FILE__, __LINE__, fmt::format("QUARVEL_SEED={}", seed)) {
  currentSimulation = this;
}

Simulation::~Simulation() {
  scheduler.stop();
  // Released first: their destructors may still use the rest of the platform.
  listener.release();
  notifications = {};
  orientation = {};
}

Simulation& Simulation::current() {
  if (currentSimulation == nullptr) std::abort();  // the platform is used outside a simulation
  return *currentSimulation;
}

// The contracts whose operations note a call and answer from a switch; the others have their file.

Date CurrentDate() {
  return TheScheduler().wallClock();
}
std::string LocalDateText(Date date, const char*) {
  return DateText(date);
}

void CountAcceptedMessage() {
  ++Simulation::current().counters.accepted;
}
void CountDroppedMessage(StoreDrop reason) {
  ++Simulation::current().counters.dropped[static_cast<std::size_t>(reason)];
}
void AddToGauge(Gauge gauge, int difference) {
  Simulation::current().counters.gauges[static_cast<std::size_t>(gauge)] += difference;
}

std::optional<bool> DevicePropertyBoolean(std::string_view name) {
  EXPECT_EQ(name, "InternalBuild");
  return Simulation::current().internalBuild;
}
std::optional<std::int64_t> DevicePropertyInteger(std::string_view name) {
  EXPECT_EQ(name, "DeviceClassNumber");
  return Simulation::current().deviceClass;
}

std::string DiagnosticsPath(std::string_view path) {
  return std::string(path);
}
Outcome CreateDirectory(std::string_view, std::uint32_t) {
  const auto& error = Simulation::current().files.directoryError;
  return error ? Outcome(*error) : Success();
}
Outcome WriteFileAtomically(std::string_view path, std::string_view content) {
  SimulatedFiles& files = Simulation::current().files;
  files.writes.emplace_back(path, content);
  return files.writeError ? Outcome(*files.writeError) : Success();
}

std::string LogLine::text() const {
  constexpr const char* kLevels[] = {"error", "default", "info", "debug"};
  return fmt::format("{} {} {}: {}", kLevels[static_cast<std::size_t>(level)], scope, function,
                     message);
}
std::vector<std::string> SimulatedLog::texts(std::string_view prefix) const {
  std::vector<std::string> texts;
  for (const LogLine& line : lines) {
    if (std::string text = line.text(); text.starts_with(prefix)) texts.push_back(std::move(text));
  }
  return texts;
}
std::vector<std::string> SimulatedLog::messages() const {
  std::vector<std::string> messages;
  for (const LogLine& line : lines) messages.push_back(line.message);
  return messages;
}
LogHandle ZQLogRegister(std::uint32_t code, std::string_view scope, std::string_view,
                        std::string_view, int, int) {
  static std::map<std::uint32_t, LogScope> scopes;
  return &scopes.try_emplace(code, LogScope{std::string(scope)}).first->second;
}
bool ZQLogEnabled(LogLevel level, LogHandle scope) {
  if (level != LogLevel::debug) return true;
  return scope != nullptr && Simulation::current().log.verbose.contains(scope->name);
}
void ZQLogWrite(LogHandle scope, LogLevel level, const char*, int, const char* function,
                std::string_view message) {
  if (TheScheduler().stopped()) return;
  EXPECT_TRUE(ZQLogEnabled(level, scope)) << "written without asking: " << message;
  auto& lines = Simulation::current().log.lines;
  lines.push_back(
      {level, scope == nullptr ? "[default]" : scope->name, function, std::string(message)});
  Simulation::current().note("log " + lines.back().text());
}

std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                     WorkQueue& queue, NotificationHandler handler) {
  SimulatedNotifications& facility = Simulation::current().notifications;
  if (facility.registrationStatus != 0) return facility.registrationStatus;
  token = static_cast<NotificationToken>(facility.registrations.size() * 100 + 100);
  facility.registrations.emplace_back(new SimulatedNotifications::Registration{
      std::string(name), token, &queue, std::move(handler)});
  return 0;
}
void SimulatedNotifications::post(std::string_view name, NotificationToken tokenOffset) {
  for (const auto& registration : registrations) {
    if (registration->name != name || registration->pending) continue;
    registration->pending = true;
    Simulation::current().arrivals.push_back({Arrival::Kind::notification, 0, nullptr});
    registration->queue->async([registration, tokenOffset] {
      registration->pending = false;
      registration->handler(registration->token + tokenOffset);
    });
  }
}

void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t) {
  Simulation::current().note(fmt::format("ohmrik {} {}", domain, name));
  Simulation::current().powerRecords.push_back(record);
}
void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload) {
  Simulation::current().note(fmt::format("vistrel {}", name));
  Simulation::current().analyticsEvents.emplace_back(name, payload());
}
void EmitKernelTrace(std::uint32_t code, std::uint64_t, std::uint64_t, std::uint64_t,
                     std::uint64_t) {
  Simulation::current().note(fmt::format("trace {:#x}", code));
}

void SimulatedOrientation::turn(const Handlers& handlers, Orientation orientation) {
  Simulation::current().spawn("orientation", [&handlers, orientation] {
    for (const auto& [callbackID, handler] : handlers) handler(orientation);
  });
}
void RegisterDeviceOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  Simulation::current().orientation.device[std::string(callbackID)] = std::move(handler);
}
void UnregisterDeviceOrientationHandler(std::string_view callbackID) {
  Simulation::current().orientation.device.erase(std::string(callbackID));
}
void RegisterUIOrientationHandler(std::string_view callbackID, OrientationHandler handler) {
  Simulation::current().orientation.ui[std::string(callbackID)] = std::move(handler);
}
void UnregisterUIOrientationHandler(std::string_view callbackID) {
  Simulation::current().orientation.ui.erase(std::string(callbackID));
}

PreferencesDomain OpenPreferencesDomain(std::string_view name) {
  const auto& preferences = Simulation::current().preferences;
  const auto found = preferences.find(name);
  return found == preferences.end() ? PreferencesDomain() : PreferencesDomain(found->second);
}

std::int32_t OwnProcessIdentifier() {
  return 4711;
}
std::string OwnProcessName() {
  return "quarveld";
}
std::optional<std::string> ProcessCommandName(std::int32_t processIdentifier) {
  EXPECT_GE(processIdentifier, 1);
  const auto& table = Simulation::current().processes;
  const auto found = table.find(processIdentifier);
  return found == table.end() ? std::nullopt : std::optional(found->second);
}
void ExitProcess(int status) {
  Simulation::current().note(fmt::format("exit {}", status));
  TheScheduler().stop();
  throw ThreadEnded{};
}

std::uint32_t RandomBelow(std::uint32_t bound) {
  SimulatedRandom& random = Simulation::current().random;
  return random.largest ? bound - 1 : static_cast<std::uint32_t>(random.source() % bound);
}

}  // namespace quarvel
