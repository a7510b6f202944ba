// The whole service on the simulated platform, compared with a model of its output. A failure names
// its seed; QUARVEL_SEED replays it, QUARVEL_SEEDS is the number of seeds. A program of its own,
// since a process reads only once whether it is an internal build.

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>

#include "tests/Statistics/Service/CoreFixtures.h"
#include "tests/simulation/Model.h"

namespace quarvel {
namespace {

// Clients choose from few values, so that they interfere with each other.
constexpr std::int64_t kReporterIDs[] = {0, 1, 2, 3, -1, INT64_MIN, INT64_MAX};
constexpr std::uint16_t kServiceTypes[] = {2, 3, 4, 7, 11, 65535};
constexpr std::uint32_t kCategories[] = {3,           0x2000'0003, 0x4000'0007,
                                         0x2000'0007, 0x1000'1234, 0xffff'ffff};
constexpr std::uint16_t kTypes[] = {1, 2, 99};
// A name with a separator, and one with a character across its 128th byte.
const std::string kApplications[] = {"player", "a/b", std::string(127, 'n') + "\u00e9 and more"};
constexpr Date::duration kSteps[] = {1s, 1min, 24h, 24h * 3650};
const bool kInternalBuild = std::getenv("QUARVEL_CUSTOMER_BUILD") == nullptr;
constexpr const char* kSessionQueue = "tarnwick.quarvel.session.relmreporting";

bool Same(const Model::Message& expected, const SimulatedAgent::Message& given) {
  return expected.category == given.category && expected.type == given.type &&
         expected.payload == given.payload.root().toDictionary();
}

/// The whole service with random clients, agent faults, file faults and clock steps, all drawn from
/// the seed. The test owns it, runs it once and reads its findings.
class World {
 public:
  struct Counts {
    std::size_t calls = 0;
    std::size_t accepted = 0;    // messages: the sum of the next three
    std::size_t handedOver = 0;  // messages and single messages that reached the agent
    std::size_t refused = 0;     // by the agent
    std::size_t dropped = 0;     // no agent session, or the service type "test"
    std::size_t droppedForType = 0;
    std::size_t droppedAmbiguously = 0;
  };

  explicit World(std::uint64_t seed)
      : random_(~seed),
        service_(seed, [](Simulation& simulation) { simulation.internalBuild = kInternalBuild; }),
        simulation_(service_) {
    simulation_.deviceClass = oneIn(2) ? 6 : 1;
    simulation_.spuriousWakeUps = oneIn(4);
  }

  /// Simulates until every client has ended, and compares the output with the model's.
  void run() {
    const std::uint64_t steps = 10 + draw(30);
    for (std::uint64_t i = 0; i < steps; ++i) step();
    simulation_.agent.full = false;
    for (Client& client : clients_) client.end();
    std::ranges::move(clients_, std::back_inserter(gone_));
    clients_.clear();
    service_.run();
    compare();
  }

  /// A sentence for each deviation from the model.
  [[nodiscard]] const std::vector<std::string>& findings() const { return findings_; }
  [[nodiscard]] const Counts& counts() const { return counts_; }

 private:
  [[nodiscard]] std::uint64_t draw(std::uint64_t bound) { return random_() % bound; }
  [[nodiscard]] bool oneIn(std::uint64_t chances) { return draw(chances) == 0; }
  void expect(bool holds, const std::string& otherwise) {
    if (!holds) findings_.push_back(otherwise);
  }
  [[nodiscard]] const auto& pick(const auto& from) { return from[draw(std::size(from))]; }

  [[nodiscard]] Dictionary drawPayload() {
    Dictionary payload = {{"n", ++messages_}};
    if (oneIn(3)) payload.set("a key", static_cast<std::int64_t>(draw(5)));
    if (oneIn(5)) payload.set("a_key", "the other");
    if (oneIn(5)) payload.set(7, Dictionary{{"in depth", List{1, 2.5, true, nullptr}}});
    if (oneIn(8)) payload.set("EngineOnTime", 1.5);
    if (oneIn(3)) payload.set("zqreporting_timestamp", 7);
    if (oneIn(8)) payload.set("HostApplicationDisplayID", "another");
    return payload;
  }
  void step() {
    if (clients_.empty() || (clients_.size() < 5 && oneIn(4))) {
      const auto pid = static_cast<std::int32_t>(100 + draw(3));
      if (oneIn(2)) simulation_.processes[pid] = "a client";
      clients_.emplace_back(simulation_.listener.connect(pid));
    }
    for (std::uint64_t calls = 1 + draw(8); calls > 0; --calls)
      call(clients_[draw(clients_.size())]);
    if (oneIn(8)) {
      std::swap(clients_[draw(clients_.size())], clients_.back());
      clients_.back().end(oneIn(2));
      gone_.push_back(std::move(clients_.back()));
      clients_.pop_back();
    }
    if (oneIn(3)) injectFault();
    // Often too short to finish the pending work.
    simulation_.runFor(oneIn(3) ? Scheduler::Duration(1s * draw(15)) : Scheduler::Duration(0));
  }
  void call(Client& client) {
    const std::int64_t id = pick(kReporterIDs);
    ++counts_.calls;
    const std::function<void()> calls[] = {
        [&] { client.create(id); },
        [&] { client.create(id); },
        [&] { client.createStarted(id); },
        [&] { client.start(id); },
        [&] { client.start(id); },
        [&] { client.setServiceType(pick(kServiceTypes), id); },
        [&] {
          client.configure(oneIn(2) ? Dictionary{{"HostApplicationDisplayID", pick(kApplications)}}
                                    : Dictionary{{"key", fmt::format("value {}", draw(3))}},
                           id);
        },
        [&] { client.serviceType(id); },
        [&] { client.valid(id); },
        [&] { client.reporters(); },
        [&] { client.stop(id); },
        [&] {
          if (oneIn(2)) client.destroy(id);
        },
    };
    const std::uint64_t drawn = draw(16);
    drawn < std::size(calls) ? calls[drawn]() : sendMessage(client);
  }
  void sendMessage(Client& client) {
    std::optional<List> reporterIDs;
    if (!oneIn(3)) {
      reporterIDs.emplace();
      for (std::uint64_t count = draw(4); count > 0; --count) {
        reporterIDs->emplace_back(pick(kReporterIDs));
      }
    }
    const std::uint32_t category = pick(kCategories);
    // The codes of a summary, whose number such a message continues.
    const std::uint16_t type = category == 0xffff'ffff ? 0xffff : pick(kTypes);
    client.send(drawPayload(), category, type, std::move(reporterIDs));
  }
  void injectFault() {
    const Error error{"tarnwick.test", 28, {}};
    const auto perhaps = [&] { return oneIn(3) ? std::optional(error) : std::nullopt; };
    SimulatedAgent& agent = simulation_.agent;
    const std::function<void()> faults[] = {
        [&] { agent.answers = !oneIn(3); },
        [&] {
          agent.backends = oneIn(3) ? std::nullopt : std::optional(std::vector<std::string>{"a"});
        },
        // At once, or around the limit of 9 s.
        [&] { agent.answersAfter = 1s * draw(2) * (8 + draw(3)); },
        [&] { agent.sendError = perhaps(); },
        [&] { agent.flushError = perhaps(); },
        [&] { agent.singleMessageError = perhaps(); },
        [&] { agent.full = !agent.full; },
        [&] {
          simulation_.files.writeError = perhaps();
          simulation_.files.directoryError = perhaps();
        },
        [&] {
          const Date::duration step = pick(kSteps);
          simulation_.scheduler.setWallClock(simulation_.scheduler.wallClock() +
                                             (oneIn(2) ? step : -step));
          clockSteps_ = true;
        },
        [&] { changePreferences(); },
    };
    pick(faults)();
  }

  /// Makes one change at a time, so that the model knows the content at each notification.
  void changePreferences() {
    constexpr const char* kRead =
        "default zqrs -[ZQReportingServiceDelegate listenForDefaultsNotification]: re-reading";
    if (simulation_.log.texts(kRead).size() != model_.preferences.size()) return;
    Dictionary preferences;
    if (oneIn(2)) preferences.set("device_name", fmt::format("device {}", draw(3)));
    if (oneIn(2)) preferences.set("disable_reporting", oneIn(2));
    model_.preferences.push_back(preferences);
    simulation_.preferences["tarnwick.quarvel"] = std::move(preferences);
    simulation_.notifications.post("tarnwick.quarvel.reporting");
  }
  void compare() {
    for (const Arrival& arrival : simulation_.arrivals) model_.execute(arrival);
    // The orientation facility keeps a session that is replaced while it is started.
    simulation_.orientation = {};
    compareReplies();
    compareAgentSessions();
    compareSingleMessages();
    compareSinks();
    compareHistories();
    compareCounters();
  }
  void compareReplies() {
    for (const auto& [call, expected] : model_.answers) {
      const std::vector<Value>& given = call->results;
      expect(!call->fault,
             fmt::format("{} was refused: {}", call->method, call->fault.value_or("")));
      expect(given == expected, fmt::format("{} {} was answered {} instead of {}", call->method,
                                            JsonText(call->arguments), JsonText(List(given)),
                                            JsonText(List(expected))));
    }
  }

  /// The queue of an agent session identifies the reporting session that made it.
  void compareAgentSessions() {
    std::vector<std::size_t> queues;
    for (const auto& [label, number] : simulation_.queues) {
      if (label == kSessionQueue) queues.push_back(number);
    }
    expect(
        queues.size() == model_.sessions.size(),
        fmt::format("{} sessions were made instead of {}", queues.size(), model_.sessions.size()));
    std::map<std::size_t, std::vector<const SimulatedAgent::Session*>> made;
    for (const SimulatedAgent::Session& session : simulation_.agent.sessions) {
      made[session.queue].push_back(&session);
      expect(session.released, "an agent session was never released");
      counts_.refused += session.offered.size() - session.messages.size();
      counts_.handedOver += session.messages.size();
    }
    for (std::size_t i = 0; i < std::min(queues.size(), model_.sessions.size()); ++i) {
      const Model::Session& session = model_.sessions[i];
      if (!session.ambiguous) {
        compareRuns(session, made[queues[i]]);
        continue;
      }
      std::size_t dropped = 0;
      for (const Model::Run& run : session.runs) dropped += run.messages.size();
      for (const auto* given : made[queues[i]]) dropped -= given->offered.size();
      counts_.dropped += dropped;
      counts_.droppedAmbiguously += dropped;
    }
  }
  void compareRuns(const Model::Session& session,
                   const std::vector<const SimulatedAgent::Session*>& made) {
    auto next = made.begin();
    for (std::size_t i = 0; i < session.runs.size(); ++i) {
      const Model::Run& run = session.runs[i];
      if (!run.reported) {
        counts_.dropped += run.messages.size();
        counts_.droppedForType += run.messages.size();
        continue;
      }
      const std::string which = fmt::format("run {} of a session {}", i + 1, session.reporterID);
      if (next == made.end()) return expect(false, which + " got no agent session");
      const SimulatedAgent::Session& given = **next++;
      const Value* token = given.info.find("HierarchyToken");
      expect(given.info == Dictionary{{"ClientType", 19},
                                      {"ClientVersion", 2.0},
                                      {"SessionID", session.reporterID},
                                      {"BatchEvent", true},
                                      {"HierarchyToken", token == nullptr ? Value() : *token}},
             which + " was announced as " + JsonText(given.info));
      const bool known = std::ranges::any_of(run.userInfos, [&](const Dictionary& userInfo) {
        Dictionary all = {{"ClientName", "tarnwick.quarvel"}, {"ServiceName", run.serviceName}};
        all.merge(userInfo);
        return given.userInfo == all;
      });
      expect(known, which + " has the user information " + JsonText(given.userInfo));
      // Kept when the backends were found within 9 s, which is uncertain while clocks step.
      const bool kept = !given.offered.empty() || given.flushes > 0;
      const bool certain = !clockSteps_ && given.foundAfter != 9s && !simulation_.spuriousWakeUps;
      const bool found = given.foundAfter && (!certain || *given.foundAfter < 9s);
      expect(found || !kept, which + " was reported without backends");
      if (!kept && found && !certain) {
        counts_.dropped += run.messages.size();
        continue;
      }
      const std::size_t flushes = found && run.stopped ? 1 : 0;
      expect(given.flushes == flushes,
             fmt::format("{} was flushed {} times instead of {}", which, given.flushes, flushes));
      if (!found) {
        counts_.dropped += run.messages.size();
        continue;
      }
      expect(std::ranges::equal(run.messages, given.offered, &Same),
             fmt::format("{}: {} messages reached the agent, not the {} sent ones in order", which,
                         given.offered.size(), run.messages.size()));
    }
    expect(next == made.end(), "an agent session belongs to no run");
  }

  /// One message to several sessions becomes several single messages that differ in the service
  /// name alone: a name that one of these sessions has had since.
  void compareSingleMessages() {
    const auto number = [](const Dictionary& payload) { return *payload.find("n")->integer(); };
    std::multimap<std::int64_t, const SimulatedAgent::SingleMessage*> given;
    for (const auto& single : simulation_.agent.singleMessages) {
      given.emplace(number(single.message.payload.root().toDictionary()), &single);
      ++(single.refused ? counts_.refused : counts_.handedOver);
    }
    std::map<std::int64_t, std::set<std::string>> names;
    for (const Model::SingleMessage& sent : model_.singleMessages) {
      names[number(sent.message.payload)].merge(std::set(sent.serviceNames));
    }
    const Dictionary info = {{"ClientType", 19}, {"ClientVersion", 2.0}, {"SessionID", -1}};
    for (const Model::SingleMessage& sent : model_.singleMessages) {
      const auto found = given.find(number(sent.message.payload));
      if (found == given.end()) {
        expect(false, "a single message is missing: " + JsonText(sent.message.payload));
        continue;
      }
      const SimulatedAgent::SingleMessage& single = *found->second;
      const Value* name = single.userInfo.find("ServiceName");
      const bool named =
          name != nullptr && names[found->first].contains(*name->string()) &&
          single.userInfo == Dictionary{{"ClientName", "tarnwick.quarvel"}, {"ServiceName", *name}};
      expect(Same(sent.message, single.message) && named && single.info == info,
             "a single message is not as it was sent: " + JsonText(sent.message.payload) +
                 JsonText(single.info) + JsonText(single.userInfo));
      given.erase(found);
    }
    expect(given.empty(), fmt::format("{} single messages too many", given.size()));
  }
  void compareSinks() {
    std::vector<std::pair<std::string, Dictionary>> given;
    std::size_t uptimes = 0;
    for (const auto& [name, payload] : simulation_.analyticsEvents) {
      if (name == "tarnwick.quarvel.zqreportingclientuptime") {
        ++uptimes;
      } else {
        given.emplace_back(name, payload.root().toDictionary());
      }
    }
    expect(given == model_.events,
           fmt::format("{} analytics events, not the {} expected ones in order", given.size(),
                       model_.events.size()));
    expect(uptimes <= model_.endedClients, "a client's time was reported twice");
    expect(std::ranges::equal(simulation_.powerRecords, model_.powerRecords, {},
                              [](const auto& record) { return record.root().toDictionary(); }),
           "the power log has other records");
  }
  void compareHistories() {
    const auto& written = simulation_.files.writes;
    if (!kInternalBuild) return expect(written.empty(), "a history was written");
    expect(written.size() == model_.histories.size(),
           fmt::format("{} histories instead of {}", written.size(), model_.histories.size()));
    for (std::size_t i = 0; i < std::min(written.size(), model_.histories.size()); ++i) {
      const Model::History& expected = model_.histories[i];
      List entries = {expected.userInfo};
      for (const auto& [messageID, payload] : expected.messages) {
        entries.emplace_back(Dictionary{{messageID, payload}});
      }
      const auto read = ValueFromJson(written[i].second);
      // As JSON, whose keys are all texts.
      expect(read && read.value() == ValueFromJson(JsonText(entries)).value(),
             fmt::format("history {} has other messages", written[i].first));
      expect(written[i].first.ends_with(expected.fileNameEnd),
             fmt::format("{} does not end in {}", written[i].first, expected.fileNameEnd));
    }
  }

  /// Accepted messages are accounted for, by the service's own counters too.
  void compareCounters() {
    counts_.accepted = model_.singleMessages.size();
    for (const Model::Session& session : model_.sessions) {
      for (const Model::Run& run : session.runs) counts_.accepted += run.messages.size();
    }
    const SimulatedCounters& counters = simulation_.counters;
    expect(counts_.accepted == counts_.handedOver + counts_.refused + counts_.dropped,
           "accepted messages differ from delivered and dropped ones");
    expect(counters.accepted == counts_.accepted + model_.unroutable,
           "accepted messages are miscounted");
    const std::size_t forType = counters.of(StoreDrop::testServiceType);
    expect(counters.of(StoreDrop::noSuchSession) == model_.unroutable &&
               forType + counters.of(StoreDrop::noAgentSession) == counts_.dropped &&
               forType >= counts_.droppedForType &&
               forType <= counts_.droppedForType + counts_.droppedAmbiguously,
           "dropped messages are miscounted");
    for (const Client& client : gone_) {
      expect(client.isReleased(), "a connection is kept after its end");
    }
    expect(counters.gauges == std::array<std::int64_t, 3>{},
           "released clients or sessions are still counted");
  }
  std::mt19937_64 random_;
  RunningService service_;
  Simulation& simulation_;
  std::vector<Client> clients_;
  std::vector<Client> gone_;
  Model model_;
  std::int64_t messages_ = 0;
  bool clockSteps_ = false;
  Counts counts_;
  std::vector<std::string> findings_;
};

TEST(ServiceSimulation, OutputMatchesTheModel) {
  World::Counts total;
  for (const auto seed : Seeds()) {
    World world(seed);
    world.run();
    EXPECT_EQ(world.findings(), std::vector<std::string>()) << "QUARVEL_SEED=" << seed;
    total.calls += world.counts().calls;
    total.accepted += world.counts().accepted;
    total.handedOver += world.counts().handedOver;
    total.refused += world.counts().refused;
    total.dropped += world.counts().dropped;
  }
  std::printf(
      "harness: simulation: %zu seeds, %zu calls, %zu messages: %zu handed over, %zu refused, %zu "
      "dropped\n",
      static_cast<std::size_t>(Seeds().size()), total.calls, total.accepted, total.handedOver,
      total.refused, total.dropped);
}

}  // namespace
}  // namespace quarvel
