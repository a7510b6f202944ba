#pragma once

#include <fmt/format.h>

#include <algorithm>

#include "base/Json.h"
#include "base/Vocabulary.h"
#include "tests/simulated/Recorders.h"

namespace quarvel {

inline constexpr std::uint16_t kTest = 11;  // service type
inline std::string ServiceName(std::uint16_t type) {
  return std::string(vocabulary::NameOf(vocabulary::ServiceType{type}));
}

inline std::string MessageName(std::uint32_t category, char separator, std::uint16_t type) {
  return fmt::format("{}{}{}", vocabulary::NameOf(vocabulary::Category(category)), separator,
                     vocabulary::NameOf(vocabulary::MessageType{type}));
}

/// The application in the name of a history file: at most 128 bytes of whole characters.
inline std::string FileNamePart(std::string name) {
  if (name.size() > 128) {
    std::size_t end = 128;
    while ((static_cast<unsigned char>(name[end]) & 0xc0) == 0x80) --end;
    name.resize(end);
  }
  std::ranges::replace(name, '/', '_');
  return name;
}

/// The output that the service owes its clients, the agent, the sinks and the diagnostics
/// directory. Computed in one pass from the order of arrivals alone: no queues, no time, none of
/// the service's code. A `World` owns it and reads its results after the simulation.
class Model {
 public:
  struct Message {
    std::uint16_t category;
    std::uint16_t type;
    Dictionary payload;
  };
  /// A session from a start to its stop.
  struct Run {
    bool reported;  // false for the service type "test"
    std::string serviceName;
    std::vector<Dictionary> userInfos;  // at the start and after each later merge
    std::vector<Message> messages;
    bool stopped = false;
  };
  struct Session {
    std::int64_t reporterID;
    std::uint16_t serviceType = 65535;
    Dictionary userInfo;
    bool started = false;
    std::vector<const RecordedCall*> starts;  // answered at the stop: none or one
    std::vector<Run> runs;
    std::map<std::string, int> counts;                        // message name to number
    std::vector<std::pair<std::string, Dictionary>> history;  // of this run
    /// The service type became or ceased to be "test" after a start. Thread timing then decides
    /// which of the queued messages are reported.
    bool ambiguous = false;
  };
  struct SingleMessage {
    Message message;
    /// Names that the session has had since the sending; the name at the delivery counts.
    std::set<std::string> serviceNames;
    const Session* session;  // null for a broadcast
  };
  struct History {
    std::string fileNameEnd;
    Dictionary userInfo;
    std::vector<std::pair<std::string, Dictionary>> messages;
  };

  void execute(const Arrival& arrival) {
    if (arrival.kind == Arrival::Kind::notification) return readPreferences();
    if (arrival.kind == Arrival::Kind::connection) return clients_.push_back({arrival.client, {}});
    const auto client = std::ranges::find(clients_, arrival.client, &Client::number);
    if (arrival.kind == Arrival::Kind::call) return execute(*client, *arrival.call);
    for (const auto& [reporterID, session] : client->sessions) {
      if (session->started) stop(*session);
    }
    clients_.erase(client);
    ++endedClients;
  }
  /// Contents of the preferences, one for each notification to come.
  std::deque<Dictionary> preferences;

  // Expected output, each in order where the service has an order.
  std::map<const RecordedCall*, std::vector<Value>> answers;  // an error as its text
  std::deque<Session> sessions;                               // in order of creation
  std::vector<SingleMessage> singleMessages;
  std::vector<std::pair<std::string, Dictionary>> events;
  std::vector<Dictionary> powerRecords;
  std::vector<History> histories;
  std::size_t endedClients = 0;
  std::size_t unroutable = 0;  // messages for sessions that do not exist

 private:
  /// With blanks in the payload's own keys replaced.
  static Message agentMessage(std::uint32_t category, std::uint16_t type,
                              const Dictionary& payload) {
    Message message = {static_cast<std::uint16_t>(category % 0x1'0000), type, {}};
    for (const auto& [key, value] : payload) {
      std::string text = key.string() == nullptr ? "" : *key.string();
      std::ranges::replace(text, ' ', '_');
      message.payload.set(key.string() == nullptr ? key : Key(text), value);
    }
    return message;
  }
  struct Client {
    std::size_t number;
    std::map<std::int64_t, Session*> sessions;
  };

  void readPreferences() {
    const Dictionary read = preferences.front();
    preferences.pop_front();
    Dictionary defaults;
    if (const Value* name = read.find("device_name")) defaults.set("device_name", *name);
    const Value* disabled = read.find("disable_reporting");
    defaults.set("disable_reporting", disabled == nullptr ? Value(0) : *disabled);
    reporting_ = disabled == nullptr || *disabled != Value(true);
    for (Client& client : clients_) {
      for (const auto& [reporterID, session] : client.sessions) merge(*session, defaults);
    }
  }
  static Session* own(Client& client, std::int64_t reporterID) {
    const auto found = client.sessions.find(reporterID);
    return found == client.sessions.end() ? nullptr : found->second;
  }
  Session* any(Client& client, std::int64_t reporterID) {
    if (Session* session = own(client, reporterID)) return session;
    if (reporterID == 0 || !reporting_) return nullptr;
    for (Client& other : clients_) {
      if (Session* session = own(other, reporterID)) return session;
    }
    return nullptr;
  }
  void execute(Client& client, const RecordedCall& call) {
    std::vector<Value>& answer = answers[&call];
    const std::string operation = call.method.substr(0, call.method.find(':'));
    if (operation == "sendMessage") return send(client, call);
    if (operation == "getAllReporters") {
      List all;
      for (const Client& each : clients_) {
        for (const auto& [reporterID, session] : each.sessions) all.emplace_back(reporterID);
      }
      answer.emplace_back(std::move(all));
      return;
    }
    const std::int64_t id = *call.arguments.back().integer();
    Session* const mine = own(client, id);
    Session* const anyones = any(client, id);
    const std::uint16_t serviceType = anyones == nullptr ? 65535 : anyones->serviceType;
    if (operation == "getServiceNameForReporterID") {
      if (id == 0) answer.emplace_back(65535);
      answer.emplace_back(serviceType);
      return;
    }
    if (operation == "reporterID") {
      answer.emplace_back(
          Dictionary{{"reporterID", anyones == nullptr ? 0 : id}, {"serviceType", serviceType}});
      return;
    }
    if (operation == "startReportingSessionForID" && id != 0) {
      if (anyones != nullptr && !anyones->started) start(*anyones, call);
      return;
    }
    if (operation == "createReportingSession") {
      Session& session = sessions.emplace_back();
      session.reporterID = id;
      client.sessions[id] = &session;
    } else if (operation == "setConfiguration") {
      if (mine != nullptr) merge(*mine, *call.arguments.at(0).dictionary());
    } else if (mine != nullptr && id != 0) {
      if (operation == "setServiceType") {
        setServiceType(*mine, static_cast<std::uint16_t>(*call.arguments.at(0).integer()));
      } else {
        stop(*mine);
      }
      if (operation == "destroyReportingSession") client.sessions.erase(id);
    }
    answer.emplace_back(true);
  }
  static void merge(Session& session, const Dictionary& entries) {
    session.userInfo.merge(entries);
    for (Run& run : session.runs) run.userInfos.push_back(session.userInfo);
  }
  void setServiceType(Session& session, std::uint16_t serviceType) {
    if ((serviceType == kTest) != (session.serviceType == kTest) && !session.runs.empty()) {
      session.ambiguous = true;
    }
    session.serviceType = serviceType;
    for (SingleMessage& single : singleMessages) {
      if (single.session == &session) single.serviceNames.insert(ServiceName(serviceType));
    }
  }
  void start(Session& session, const RecordedCall& call) {
    session.started = true;
    session.history.clear();
    const std::string name = ServiceName(session.serviceType) + "_session";
    session.runs.push_back({session.serviceType != kTest, name, {session.userInfo}, {}});
    // The previous start is answered once more.
    for (const RecordedCall* start : session.starts) answers[start].emplace_back(true);
    session.starts = {&call};
  }
  void stop(Session& session) {
    if (!session.started) return;
    Run& run = session.runs.back();
    if (!session.history.empty()) {
      Dictionary summary = {{"ZQ_Session_Summary_Event", std::to_string(session.serviceType)}};
      for (const auto& [messageID, payload] : session.history) {
        summary.set(messageID, JsonText(payload));
      }
      run.messages.push_back({0xffff, 0xffff, summary});
      const Value* application = session.userInfo.find("HostApplicationDisplayID");
      const std::string name =
          application == nullptr ? "unknown" : FileNamePart(*application->string());
      histories.push_back(
          {fmt::format("-quarvel-{}-{}.json", name, ServiceName(session.serviceType)),
           session.userInfo, session.history});
      ++session.counts[MessageName(0xffff'ffff, '_', 0xffff)];
    }
    run.stopped = true;
    session.started = false;
    for (const RecordedCall* start : session.starts) answers[start].emplace_back(true);
  }
  void send(Client& client, const RecordedCall& call) {
    const Dictionary payload =
        call.arguments[0].isNil() ? Dictionary() : *call.arguments[0].dictionary();
    const auto category = static_cast<std::uint32_t>(*call.arguments[1].integer());
    const auto type = static_cast<std::uint16_t>(*call.arguments[2].integer());
    if (!reporting_) {
      answers[&call].emplace_back("tarnwick.audio.reporting 1");
      return;
    }
    std::vector<Session*> targets;
    if (const List* reporterIDs = call.arguments[3].list()) {
      for (const Value& reporterID : *reporterIDs) {
        const std::int64_t id = *reporterID.integer();
        Session* session = id == 0 ? nullptr : any(client, id);
        session == nullptr ? void(++unroutable) : targets.push_back(session);
      }
    } else {
      for (Client& each : clients_) {
        for (const auto& [reporterID, session] : each.sessions) {
          if (session->started) targets.push_back(session);
        }
      }
      if (targets.empty()) {
        singleMessages.push_back(
            {agentMessage(category, type, payload), {ServiceName(5)}, nullptr});
      }
    }
    for (Session* session : targets) deliver(*session, payload, category, type);
    answers[&call].emplace_back();
  }

  /// Offers the message to both sinks, then delivers it.
  void deliver(Session& session, const Dictionary& payload, std::uint32_t category,
               std::uint16_t type) {
    const Value* application = session.userInfo.find("HostApplicationDisplayID");
    const Value named = application == nullptr ? Value("Unknown") : *application;
    Dictionary event = payload;
    event.set("HostApplicationDisplayID", named);
    events.emplace_back("tarnwick.quarvel." + MessageName(category, '.', type), event);
    if (const Value* engineOnTime = payload.find("EngineOnTime")) {
      Dictionary& record = powerRecords.emplace_back(
          Dictionary{{"EngineOnDuration", *engineOnTime}, {"ApplicationName", named}});
      const Value* timestamp = payload.find("zqreporting_timestamp");
      if (timestamp != nullptr) record.set("TimestampEnd", *timestamp);
    }
    const std::string name = MessageName(category, '_', type);
    const std::string messageID = fmt::format("{}_{}", name, ++session.counts[name]);
    const Message message = agentMessage(category, type, payload);
    if (session.started) {
      session.history.emplace_back(messageID, message.payload);
      session.runs.back().messages.push_back(message);
    } else {
      singleMessages.push_back({message, {ServiceName(session.serviceType)}, &session});
    }
  }
  std::vector<Client> clients_;  // in order of acceptance
  bool reporting_ = true;
};

}  // namespace quarvel
