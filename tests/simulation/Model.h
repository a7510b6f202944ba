#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "base/Value.h"
#include "tests/simulated/Recorders.h"

namespace quarvel {

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

  void execute(const Arrival& arrival);
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
  struct Client {
    std::size_t number;
    std::map<std::int64_t, Session*> sessions;
  };

  void execute(Client& client, const RecordedCall& call);
  void send(Client& client, const RecordedCall& call);
  void readPreferences();
  [[nodiscard]] static Session* own(Client& client, std::int64_t reporterID);
  [[nodiscard]] Session* any(Client& client, std::int64_t reporterID);
  static void merge(Session& session, const Dictionary& entries);
  void setServiceType(Session& session, std::uint16_t serviceType);
  void start(Session& session, const RecordedCall& call);
  void stop(Session& session);
  void deliver(Session& session, const Dictionary& payload, std::uint32_t category,
               std::uint16_t type);
  void offerToSinks(const Session& session, const Dictionary& payload, std::uint32_t category,
                    std::uint16_t type);

  std::vector<Client> clients_;  // in order of acceptance
  bool reporting_ = true;
};

}  // namespace quarvel
