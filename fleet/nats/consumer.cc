// A consumer of the stream: prints each row once, one JSON line for each. The stream drops repeats
// only within its duplicate window. A device that was offline for longer may send a batch again, so
// the consumer drops repeats by the rows' names.
//
// usage: nats-consumer URL STREAM [--until-empty]

#include <nats/nats.h>

#include <cstdio>
#include <cstring>
#include <deque>
#include <string>
#include <unordered_set>

namespace {

constexpr int kBatch = 500;
constexpr long kPatienceMilliseconds = 2000;
constexpr std::size_t kRemembered = 1'000'000;  // row names, some hundred megabytes

/// The names of the latest rows.
class Names {
 public:
  /// Adds a name; false if it is known.
  bool add(const std::string& name) {
    if (!known_.insert(name).second) return false;
    order_.push_back(name);
    if (order_.size() > kRemembered) {
      known_.erase(order_.front());
      order_.pop_front();
    }
    return true;
  }

 private:
  std::unordered_set<std::string> known_;
  std::deque<std::string> order_;
};

void Print(natsMsg* message, Names& names) {
  const char* name = "";
  natsMsgHeader_Get(message, "Nats-Msg-Id", &name);
  if (names.add(name)) {
    std::printf("{\"name\":\"%s\",\"subject\":\"%s\",\"row\":%.*s}\n", name,
                natsMsg_GetSubject(message), natsMsg_GetDataLength(message),
                natsMsg_GetData(message));
  }
}

natsStatus Consume(natsSubscription* subscription, bool untilEmpty) {
  Names names;
  for (;;) {
    natsMsgList messages{};
    jsErrCode code{};
    const natsStatus status =
        natsSubscription_Fetch(&messages, subscription, kBatch, kPatienceMilliseconds, &code);
    if (status == NATS_TIMEOUT) {
      if (untilEmpty) return NATS_OK;
      continue;
    }
    if (status != NATS_OK) return status;
    for (int i = 0; i < messages.Count; ++i) {
      Print(messages.Msgs[i], names);
      natsMsg_Ack(messages.Msgs[i],
                  nullptr);  // only now: an unacknowledged message is delivered again
    }
    natsMsgList_Destroy(&messages);
    std::fflush(stdout);
  }
}

}  // namespace

int main(int argumentCount, char** arguments) {
  const bool untilEmpty = argumentCount == 4 && std::strcmp(arguments[3], "--until-empty") == 0;
  if (argumentCount != 3 && !untilEmpty) {
    std::fprintf(stderr, "usage: nats-consumer URL STREAM [--until-empty]\n");
    return 2;
  }
  natsConnection* connection = nullptr;
  jsCtx* js = nullptr;
  natsSubscription* subscription = nullptr;
  jsSubOptions options;
  jsSubOptions_Init(&options);
  options.Stream = arguments[2];
  natsStatus status = natsConnection_ConnectTo(&connection, arguments[1]);
  if (status == NATS_OK) status = natsConnection_JetStream(&js, connection, nullptr);
  // Without a durable name the consumer begins with the stream's first message; with one it would
  // continue after the last acknowledged message.
  if (status == NATS_OK) {
    status = js_PullSubscribe(&subscription, js, "quarvel.>", nullptr, nullptr, &options, nullptr);
  }
  if (status == NATS_OK) status = Consume(subscription, untilEmpty);
  if (status != NATS_OK) {
    std::fprintf(stderr, "nats-consumer: %s\n", natsStatus_GetText(status));
  }
  natsSubscription_Destroy(subscription);
  jsCtx_Destroy(js);
  natsConnection_Destroy(connection);
  nats_Close();
  return status == NATS_OK ? 0 : 1;
}
