#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <set>

#include "base/Json.h"
#include "tests/simulation/World.h"

// What the service did against what it owed.

namespace quarvel {

namespace {

constexpr const char* kSessionQueue = "tarnwick.quarvel.session.relmreporting";
constexpr const char* kSessionMade = "trace 0x21042828";
constexpr const char* kSessionDisposed = "trace 0x21042834";

bool Same(const Model::Message& owed, const SimulatedAgent::Message& given) {
  return owed.category == given.category && owed.type == given.type &&
         owed.payload == given.payload.root().toDictionary();
}

std::string Described(const Model::Session& session, std::size_t run) {
  return fmt::format("run {} of a session {}", run + 1, session.reporterID);
}

}  // namespace

void World::compare() {
  for (const Arrival& arrival : simulation_.arrivals) model_.arrived(arrival);
  // A session that is replaced while it is started goes on being told of orientation, and stays.
  simulation_.orientation = {};
  compareReplies();
  compareAgentSessions();
  compareSingleMessages();
  compareSinks();
  compareHistories();
  compareLifetimes();
  compareCounters();
}

void World::compareReplies() {
  for (const auto& [call, owed] : model_.answers) {
    const std::vector<Value>& given = call->results;
    expect(!call->fault, fmt::format("{} was refused: {}", call->method, call->fault.value_or("")));
    expect(given == owed,
           fmt::format("{} {} was answered {} instead of {}", call->method,
                       JsonText(call->arguments), JsonText(List(given)), JsonText(List(owed))));
  }
}

/// A session's queue tells which of the agent's sessions were made for it.
void World::compareAgentSessions() {
  std::vector<std::size_t> queues;
  for (const auto& queue : simulation_.queues) {
    if (queue.label == kSessionQueue) queues.push_back(queue.number);
  }
  expect(queues.size() == model_.sessions.size(),
         fmt::format("{} sessions were made instead of {}", queues.size(), model_.sessions.size()));
  std::map<std::size_t, std::vector<const SimulatedAgent::Session*>> made;
  for (const SimulatedAgent::Session& session : simulation_.agent.sessions) {
    made[session.queue].push_back(&session);
    expect(session.released, "an agent session was never let go");
    counts_.refused += session.offered.size() - session.messages.size();
    counts_.handedOver += session.messages.size();
  }
  for (std::size_t i = 0; i < std::min(queues.size(), model_.sessions.size()); ++i) {
    const Model::Session& session = model_.sessions[i];
    session.unsettled ? compareUnsettled(session, made[queues[i]])
                      : compareRuns(session, made[queues[i]]);
  }
}

void World::compareRuns(const Model::Session& session,
                        const std::vector<const SimulatedAgent::Session*>& made) {
  auto next = made.begin();
  for (std::size_t i = 0; i < session.runs.size(); ++i) {
    const Model::Run& run = session.runs[i];
    if (!run.reported) {
      counts_.dropped += run.messages.size();
      continue;
    }
    const std::string which = Described(session, i);
    if (next == made.end()) return expect(false, which + " got no agent session");
    const SimulatedAgent::Session& given = **next++;
    expect(*given.info.find("SessionID") == Value(session.reporterID) &&
               *given.userInfo.find("ServiceName") == Value(run.serviceName),
           which + " was announced to the agent as another");
    for (const auto& [key, value] : run.userInfo) {
      expect(given.userInfo.find(key) != nullptr, which + " lost user information");
    }
    // Kept when the backends were found in time; what that is is not sure while clocks step.
    const bool kept = !given.offered.empty() || !given.flushes.empty();
    const bool sure = !clockSteps_ && given.foundAfter != 9s && !simulation_.spuriousWakeUps;
    const bool found = given.foundAfter && (!sure || *given.foundAfter < 9s);
    expect(found || !kept, which + " was reported without backends");
    if (!kept && found && !sure) {
      counts_.dropped += run.messages.size();
      continue;
    }
    const std::size_t flushes = found && run.stopped ? 1 : 0;
    expect(given.flushes.size() == flushes, fmt::format("{} was flushed {} times instead of {}",
                                                        which, given.flushes.size(), flushes));
    if (!found) {
      counts_.dropped += run.messages.size();
      continue;
    }
    expect(std::ranges::equal(run.messages, given.offered, &Same),
           fmt::format("{}: {} messages reached the agent, not the {} owed in their order", which,
                       given.offered.size(), run.messages.size()));
  }
  expect(next == made.end(), "an agent session belongs to no run");
}

void World::compareUnsettled(const Model::Session& session,
                             const std::vector<const SimulatedAgent::Session*>& made) {
  std::vector<const Model::Message*> owed;
  for (const Model::Run& run : session.runs) {
    for (const Model::Message& message : run.messages) owed.push_back(&message);
  }
  counts_.dropped += owed.size();
  auto next = owed.begin();
  for (const SimulatedAgent::Session* given : made) {
    expect(given->flushes.size() <= 1, "an agent session was flushed twice");
    counts_.dropped -= given->offered.size();
    for (const SimulatedAgent::Message& message : given->offered) {
      next = std::find_if(next, owed.end(), [&](const auto* each) { return Same(*each, message); });
      if (next == owed.end()) return expect(false, "a message came out of order, or twice");
      ++next;
    }
  }
}

/// One message to several sessions is as many single messages, alike but for the service's name,
/// which may be any that one of these sessions has had since.
void World::compareSingleMessages() {
  const auto number = [](const Dictionary& payload) { return *payload.find("n")->integer(); };
  std::multimap<std::int64_t, const SimulatedAgent::SingleMessage*> given;
  for (const auto* each :
       {&simulation_.agent.singleMessages, &simulation_.agent.refusedSingleMessages}) {
    for (const auto& single : *each) {
      given.emplace(number(single.message.payload.root().toDictionary()), &single);
    }
  }
  counts_.handedOver += simulation_.agent.singleMessages.size();
  counts_.refused += simulation_.agent.refusedSingleMessages.size();
  std::map<std::int64_t, std::set<std::string>> names;
  for (const Model::SingleMessage& owed : model_.singleMessages) {
    names[number(owed.message.payload)].insert(owed.serviceNames.begin(), owed.serviceNames.end());
  }
  for (const Model::SingleMessage& owed : model_.singleMessages) {
    const auto found = given.find(number(owed.message.payload));
    if (found == given.end()) {
      expect(false, "a single message is missing: " + JsonText(owed.message.payload));
      continue;
    }
    const SimulatedAgent::SingleMessage& single = *found->second;
    expect(Same(owed.message, single.message) &&
               names[found->first].contains(*single.userInfo.find("ServiceName")->string()),
           "a single message is not what was sent: " + JsonText(owed.message.payload));
    given.erase(found);
  }
  expect(given.empty(), fmt::format("{} single messages are owed to nobody", given.size()));
}

void World::compareSinks() {
  std::vector<std::pair<std::string, Dictionary>> given;
  std::size_t uptimes = 0;
  for (const SimulatedVistrel::Event& event : simulation_.vistrel.events) {
    if (event.name == "tarnwick.quarvel.zqreportingclientuptime") {
      ++uptimes;
    } else {
      given.emplace_back(event.name, event.payload.root().toDictionary());
    }
  }
  expect(given == model_.events, fmt::format("{} analytics events, not the {} owed in their order",
                                             given.size(), model_.events.size()));
  expect(uptimes <= model_.ended, "a client's time was reported twice");
  std::vector<Dictionary> records;
  for (const auto& record : simulation_.ohmrik.records) {
    records.push_back(record.root().toDictionary());
  }
  expect(records == model_.powerRecords, "the power log holds other records than those owed");
}

void World::compareHistories() {
  const auto& written = simulation_.files.writes;
  if (!isInternalBuild()) return expect(written.empty(), "a history was written");
  expect(written.size() == model_.histories.size(),
         fmt::format("{} histories instead of {}", written.size(), model_.histories.size()));
  for (std::size_t i = 0; i < std::min(written.size(), model_.histories.size()); ++i) {
    const Model::History& owed = model_.histories[i];
    List entries = {owed.userInfo};
    for (const auto& [messageID, payload] : owed.messages) {
      entries.emplace_back(Dictionary{{messageID, payload}});
    }
    const auto read = ValueFromJson(written[i].second);
    // Compared as JSON, which has texts only for keys.
    expect(read && read.value() == ValueFromJson(JsonText(entries)).value(),
           fmt::format("history {} is not what was sent", written[i].first));
    expect(written[i].first.ends_with(owed.fileNameEnd),
           fmt::format("{} does not end in {}", written[i].first, owed.fileNameEnd));
  }
}

/// What was accepted is accounted for, by the service's own counters too.
void World::compareCounters() {
  counts_.accepted = model_.singleMessages.size();
  for (const Model::Session& session : model_.sessions) {
    for (const Model::Run& run : session.runs) counts_.accepted += run.messages.size();
  }
  const SimulatedCounters& counters = simulation_.counters;
  expect(counts_.accepted == counts_.handedOver + counts_.refused + counts_.dropped,
         "messages have vanished, or come of nothing");
  expect(counters.accepted == counts_.accepted + model_.toNobody,
         "accepted messages are miscounted");
  expect(counters.of(StoreDrop::noSuchSession) == model_.toNobody &&
             counters.of(StoreDrop::noAgentSession) + counters.of(StoreDrop::testServiceType) ==
                 counts_.dropped,
         "dropped messages are miscounted");
  expect(counters.gauges == std::array<std::int64_t, 3>{},
         "clients or sessions are counted that have gone");
}

void World::compareLifetimes() {
  for (const Client& client : gone_) {
    expect(client.connection().expired() && client.exportedObject().expired(),
           "a client that has gone is kept");
  }
  const auto traced = [&](const char* code) { return simulation_.journal.lines({code}).size(); };
  expect(traced(kSessionMade) == traced(kSessionDisposed), "a session is kept");
}

}  // namespace quarvel
