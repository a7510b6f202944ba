#include "tests/simulation/World.h"

#include <fmt/format.h>

#include <cstdlib>
#include <limits>

namespace quarvel {

namespace {

// What the clients choose from is little, so that they get in each other's way.
constexpr std::int64_t kReporterIDs[] = {0,
                                         1,
                                         2,
                                         3,
                                         -1,
                                         std::numeric_limits<std::int64_t>::min(),
                                         std::numeric_limits<std::int64_t>::max()};
constexpr std::uint16_t kServiceTypes[] = {2, 3, 4, 7, 11, 65535};
constexpr std::uint32_t kCategories[] = {3, 0x2000'0003, 0x4000'0007, 0x2000'0007, 0x1000'1234};
constexpr std::uint16_t kTypes[] = {1, 2, 99};
constexpr Date::duration kSteps[] = {1s, 1min, 24h, 24h * 3650};

}  // namespace

bool World::isInternalBuild() {
  return std::getenv("QUARVEL_CUSTOMER_BUILD") == nullptr;
}

World::World(std::uint64_t seed, Lie lie)
    : random_(~seed),
      service_(seed, [](Simulation& simulation) { simulation.internalBuild = isInternalBuild(); }),
      simulation_(service_) {
  simulation_.lie = lie;
  simulation_.deviceClass = oneIn(2) ? 6 : 1;
  simulation_.spuriousWakeUps = oneIn(4);
}

std::int64_t World::drawReporterID() {
  return kReporterIDs[draw(std::size(kReporterIDs))];
}

Dictionary World::drawPayload() {
  Dictionary payload = {{"n", ++messages_}};
  if (oneIn(3)) payload.set("a key", static_cast<std::int64_t>(draw(5)));
  if (oneIn(5)) payload.set("a_key", "the other");
  if (oneIn(5)) payload.set(7, Dictionary{{"in depth", List{1, 2.5, true, nullptr}}});
  if (oneIn(8)) payload.set("EngineOnTime", 1.5);
  if (oneIn(3)) payload.set("zqreporting_timestamp", 7);
  if (oneIn(8)) payload.set("HostApplicationDisplayID", "Somebody Else");
  return payload;
}

void World::run() {
  const std::uint64_t steps = 10 + draw(30);
  for (std::uint64_t i = 0; i < steps; ++i) step();
  simulation_.agent.full = false;
  for (Client& client : clients_) client.end();
  std::ranges::move(clients_, std::back_inserter(gone_));
  clients_.clear();
  service_.run();
  compare();
}

void World::step() {
  if (clients_.empty() || (clients_.size() < 5 && oneIn(4))) {
    const auto pid = static_cast<std::int32_t>(100 + draw(3));
    if (oneIn(2)) simulation_.processes[pid] = "a client";
    clients_.emplace_back(simulation_.listener.connect(pid));
  }
  for (std::uint64_t calls = 1 + draw(8); calls > 0; --calls) act(clients_[draw(clients_.size())]);
  if (oneIn(8)) {
    const auto leaving = clients_.begin() + static_cast<std::ptrdiff_t>(draw(clients_.size()));
    leaving->end(oneIn(2));
    gone_.push_back(std::move(*leaving));
    clients_.erase(leaving);
  }
  if (oneIn(3)) disturb();
  // Often too short for what was begun to be finished.
  simulation_.runFor(oneIn(3) ? Scheduler::Duration(1s * draw(15)) : Scheduler::Duration(0));
}

void World::act(Client& client) {
  const std::int64_t reporterID = drawReporterID();
  ++counts_.calls;
  switch (draw(16)) {
    case 0:
    case 1:
      client.create(reporterID);
      break;
    case 2:
      client.createStarted(reporterID);
      break;
    case 3:
    case 4:
      client.start(reporterID);
      break;
    case 5:
      client.setServiceType(kServiceTypes[draw(std::size(kServiceTypes))], reporterID);
      break;
    case 6:
      client.configure(
          {{oneIn(2) ? "HostApplicationDisplayID" : "key", fmt::format("value {}", draw(3))}},
          reporterID);
      break;
    case 7:
      client.serviceType(reporterID);
      break;
    case 8:
      client.valid(reporterID);
      break;
    case 9:
      client.reporters();
      break;
    case 10:
      client.stop(reporterID);
      break;
    case 11:
      if (oneIn(2)) client.destroy(reporterID);
      break;
    default:
      sendSomething(client);
  }
}

void World::sendSomething(Client& client) {
  std::optional<List> reporterIDs;
  if (!oneIn(3)) {
    reporterIDs.emplace();
    for (std::uint64_t count = draw(4); count > 0; --count) {
      reporterIDs->emplace_back(drawReporterID());
    }
  }
  client.send(drawPayload(), kCategories[draw(std::size(kCategories))],
              kTypes[draw(std::size(kTypes))], std::move(reporterIDs));
}

void World::disturb() {
  const Error error{"tarnwick.test", 28, {}};
  const auto perhaps = [&] { return oneIn(3) ? std::optional(error) : std::nullopt; };
  SimulatedAgent& agent = simulation_.agent;
  switch (draw(10)) {
    case 0:
      agent.answers = !oneIn(3);
      break;
    case 1:
      agent.backends = oneIn(3) ? std::nullopt : std::optional(std::vector<std::string>{"a"});
      break;
    case 2:
      agent.answersAfter = 1s * draw(2) * (8 + draw(3));  // at once, or around the end of patience
      break;
    case 3:
      agent.sendError = perhaps();
      break;
    case 4:
      agent.flushError = perhaps();
      break;
    case 5:
      agent.singleMessageError = perhaps();
      break;
    case 6:
      agent.full = !agent.full;
      break;
    case 7:
      simulation_.files.writeError = perhaps();
      simulation_.files.directoryError = perhaps();
      break;
    case 8: {
      const Date::duration step = kSteps[draw(std::size(kSteps))];
      simulation_.scheduler.setWallClock(simulation_.scheduler.wallClock() +
                                         (oneIn(2) ? step : -step));
      clockSteps_ = true;
      break;
    }
    default:
      changePreferences();
  }
}

/// One change at a time, so that it is known which one a notification finds.
void World::changePreferences() {
  if (simulation_.log
          .texts("default zqrs -[ZQReportingServiceDelegate "
                 "listenForDefaultsNotification]: re-reading")
          .size() != notifications_) {
    return;
  }
  Dictionary preferences;
  if (oneIn(2)) preferences.set("device_name", fmt::format("device {}", draw(3)));
  if (oneIn(2)) preferences.set("disable_reporting", oneIn(2));
  model_.preferences.push_back(preferences);
  simulation_.preferences["tarnwick.quarvel"] = std::move(preferences);
  simulation_.notifications.post("tarnwick.quarvel.reporting");
  ++notifications_;
}

std::size_t World::traceHash() const {
  std::string all;
  for (const auto& choice : simulation_.scheduler.choices()) all += choice + '\n';
  for (const auto& line : simulation_.journal.lines()) all += line + '\n';
  for (const auto& line : simulation_.log.texts()) all += line + '\n';
  return std::hash<std::string>{}(all);
}

}  // namespace quarvel
