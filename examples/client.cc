// One whole reporting session with a client that has its own thread: synchronous where the answer
// matters, asynchronous where it does not.
//
// Usage: client-cc [SOCKET]    (else $QUARVEL_SOCKET, else where the service listens by default)

#include <quarvel/client.hpp>

#include <cstdlib>
#include <future>
#include <iostream>
#include <random>

using quarvel::Client;
using quarvel::Dictionary;
using quarvel::ReporterID;
using quarvel::Result;
namespace vocabulary = quarvel::vocabulary;

namespace {

[[noreturn]] void Fail(const quarvel::Error& error) {
  std::cerr << error.description() << '\n';
  std::exit(EXIT_FAILURE);
}

template <class T>
T ValueOf(Result<T> result) {
  if (!result) Fail(result.error());
  return std::move(result.value());
}

// All clients share one space of ids; 0 is none.
ReporterID NewSession() {
  std::random_device random;
  return std::uniform_int_distribution<ReporterID>(1)(random);
}

}  // namespace

int main(int argc, char** argv) {
  Client client = ValueOf(Client::connect(argc > 1 ? argv[1] : ""));
  const ReporterID session = NewSession();

  // Calls are carried out in their order, so only the last of these need be waited for.
  client.createReportingSession(session);
  client.setServiceType(Client::ServiceType::telephony, session);
  client.setConfiguration(Dictionary{{"HostApplicationDisplayID", "org.example.phone"}}, session);
  std::promise<Result<bool>> stopped;
  const bool started = ValueOf(client.sync().startReportingSessionForID(
      session, [&stopped](Result<bool> reply) { stopped.set_value(std::move(reply)); }));
  std::cout << "started: " << std::boolalpha << started << '\n';

  const Client::Category route(vocabulary::Component::routing, vocabulary::Kind::routeChange);
  {
    // Several messages at hand go out in one write.
    const Client::Batch batch(client);
    for (const int number : {1, 2, 3}) {
      client.sendMessage(Dictionary{{"number", number}, {"route", "Receiver"}}, route,
                         Client::MessageType::start, session);
    }
  }
  // Where it must be known that the message has been routed.
  const Dictionary volume{{"volume", 0.5}};
  ValueOf(client.sync().sendMessage(volume, vocabulary::Kind::volume, Client::MessageType::generic,
                                    session));

  ValueOf(client.sync().stopReportingSessionForID(session));
  std::cout << "stopped: " << ValueOf(stopped.get_future().get()) << '\n';
  ValueOf(client.sync().destroyReportingSession(session));
}
