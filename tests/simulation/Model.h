#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "base/Value.h"
#include "tests/simulated/SimulatedListener.h"

namespace quarvel {

/// What the service owes its clients, the agent, the sinks and the diagnostics directory on an
/// internal build, worked out from the order in which things came to it and from nothing else: one
/// pass, no queues, no time, none of the service's code.
class Model {
 public:
  struct Message {
    std::uint16_t category;
    std::uint16_t type;
    Dictionary payload;
  };
  /// A session from a start to the stop.
  struct Run {
    bool reported;  // not a test
    std::string serviceName;
    Dictionary userInfo;  // at the start; more may come before the agent is asked
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
    std::map<std::string, int> counts;
    std::vector<std::pair<std::string, Dictionary>> history;  // of this run
    /// It became a test, or stopped being one, with messages perhaps still on their way: whether
    /// those were reported depends on who was faster.
    bool unsettled = false;
  };
  struct SingleMessage {
    Message message;
    /// Those of the session from the sending on: the one of the delivery counts.
    std::set<std::string> serviceNames;
    const Session* session;  // null for a broadcast
  };
  struct History {
    std::string fileNameEnd;
    Dictionary userInfo;
    std::vector<std::pair<std::string, Dictionary>> messages;
  };

  void arrived(const Arrival& arrival);
  /// What the preferences hold when the next notification is carried out.
  std::deque<Dictionary> preferences;

  // What is owed, each in order where the service has one.
  std::map<const RecordedCall*, std::vector<Value>> answers;  // an error as its text
  std::deque<Session> sessions;                               // in the order of their creation
  std::vector<SingleMessage> singleMessages;
  std::vector<std::pair<std::string, Dictionary>> events;
  std::vector<Dictionary> powerRecords;
  std::vector<History> histories;
  std::size_t ended = 0;
  std::size_t toNobody = 0;  // messages for sessions that do not exist

 private:
  struct Client {
    std::size_t number;
    std::map<std::int64_t, Session*> sessions;
  };

  void carryOut(Client& client, const RecordedCall& call);
  void send(Client& client, const RecordedCall& call);
  void readPreferences();
  [[nodiscard]] static Session* own(Client& client, std::int64_t reporterID);
  [[nodiscard]] Session* any(Client& client, std::int64_t reporterID);
  void setServiceType(Session& session, std::uint16_t serviceType);
  void start(Session& session, const RecordedCall& call);
  void stop(Session& session);
  void deliver(Session& session, const Dictionary& payload, std::uint32_t category,
               std::uint16_t type);
  void offerToSinks(const Session& session, const Dictionary& payload, std::uint32_t category,
                    std::uint16_t type);

  std::vector<Client> clients_;  // in the order of their acceptance
  bool reporting_ = true;
};

}  // namespace quarvel
