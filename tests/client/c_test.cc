#include <quarvel/quarvel.h>

#include <algorithm>

#include "tests/client/ClientTesting.h"

namespace quarvel {
namespace {

struct Free {
  void operator()(quarvel_client* client) const { quarvel_client_free(client); }
  void operator()(quarvel_payload* payload) const { quarvel_payload_free(payload); }
  void operator()(quarvel_realtime* reporter) const { quarvel_realtime_free(reporter); }
};
using PayloadHandle = std::unique_ptr<quarvel_payload, Free>;

PayloadHandle NewPayload() {
  return PayloadHandle(quarvel_payload_new());
}

class CTest : public ::testing::Test {
 protected:
  CTest() {
    path_ = service_.path();
    options_.size = sizeof options_;
    options_.socket_path = path_.c_str();
    options_.driver = QUARVEL_CALLER;
  }
  quarvel_client* connect() {
    quarvel_client* client = nullptr;
    quarvel_error error;
    EXPECT_EQ(quarvel_client_new(&options_, &client, &error), QUARVEL_OK) << error.reason;
    client_.reset(client);
    service_.accept();
    return client;
  }
  std::string call() { return JsonText(service_.call()); }

  FakeService service_;
  std::string path_;
  quarvel_options options_{};
  std::unique_ptr<quarvel_client, Free> client_;
};

TEST_F(CTest, EveryOperationHasItsFrame) {
  quarvel_client* client = connect();
  const PayloadHandle payload = NewPayload();
  quarvel_payload_integer(payload.get(), "n", 1);
  const std::int64_t sessions[] = {7, -8};
  const quarvel_status sent[] = {
      quarvel_create_reporting_session(client, 7, nullptr, nullptr),
      quarvel_set_service_type(client, QUARVEL_SERVICE_TELEPHONY, 7, nullptr, nullptr),
      quarvel_get_service_name_for_reporter_id(client, 7, nullptr, nullptr),
      quarvel_set_configuration(client, payload.get(), 7, nullptr, nullptr),
      quarvel_set_configuration(client, nullptr, 7, nullptr, nullptr),
      quarvel_start_reporting_session_for_id(client, 7, nullptr, nullptr),
      quarvel_send_message(client, payload.get(), QUARVEL_COMPONENT_TOOLBOX | QUARVEL_KIND_ERROR,
                           QUARVEL_TYPE_UNKNOWN, sessions, 2, nullptr, nullptr),
      quarvel_send_message(client, nullptr, QUARVEL_KIND_VOLUME, QUARVEL_TYPE_GENERIC, sessions, 0,
                           nullptr, nullptr),
      quarvel_send_message(client, nullptr, QUARVEL_KIND_VOLUME, QUARVEL_TYPE_GENERIC, nullptr, 0,
                           nullptr, nullptr),
      quarvel_stop_reporting_session_for_id(client, 7, nullptr, nullptr),
      quarvel_destroy_reporting_session(client, 7, nullptr, nullptr),
      quarvel_reporter_id(client, 7, nullptr, nullptr),
      quarvel_get_all_reporters(client, nullptr, nullptr),
      quarvel_kill_service(client, nullptr, nullptr),
  };
  EXPECT_THAT(sent, ::testing::Each(QUARVEL_OK));
  std::vector<std::string> calls(std::size(sent));
  std::ranges::generate(calls, [this] { return call(); });
  const std::string message = R"([2,"sendMessage:withCategory:andType:forReportingIDs:reply:",)";
  EXPECT_THAT(
      calls,
      ElementsAre(R"([2,"createReportingSession:reply:",[7]])",
                  R"([2,"setServiceType:reportingSession:reply:",[2,7]])",
                  R"([2,"getServiceNameForReporterID:reply:",[7]])",
                  R"([2,"setConfiguration:forReporterID:reply:",[{"n":1},7]])",
                  R"([2,"setConfiguration:forReporterID:reply:",[null,7]])",
                  R"([2,"startReportingSessionForID:reply:",[7]])",
                  message + R"([{"n":1},2147483656,65535,[7,-8]]])", message + "[null,11,0,[]]]",
                  message + "[null,11,0,null]]", R"([2,"stopReportingSessionForID:reply:",[7]])",
                  R"([2,"destroyReportingSession:reply:",[7]])", R"([2,"reporterID:valid:",[7]])",
                  R"([2,"getAllReporters:",[]])", R"([2,"killService:",[]])"));
}

/// Adds a reply to a list of texts.
void Say(void* replies, const std::string& result, const quarvel_error* error) {
  static_cast<std::vector<std::string>*>(replies)->push_back(
      error == nullptr ? result
                       : std::string(error->domain) + " " + std::to_string(error->code) + " " +
                             std::to_string(error->status) + ": " + error->reason);
}

TEST_F(CTest, EveryKindOfReplyArrives) {
  quarvel_client* client = connect();
  std::vector<std::string> said;
  quarvel_create_reporting_session(
      client, 7,
      [](void* to, bool result, const quarvel_error* error) {
        Say(to, result ? "true" : "false", error);
      },
      &said);
  quarvel_get_service_name_for_reporter_id(
      client, 7,
      [](void* to, std::uint16_t type, const quarvel_error* error) {
        Say(to, std::to_string(type), error);
      },
      &said);
  quarvel_reporter_id(
      client, 7,
      [](void* to, std::int64_t reporter, std::uint16_t type, const quarvel_error* error) {
        Say(to, std::to_string(reporter) + " " + std::to_string(type), error);
      },
      &said);
  quarvel_get_all_reporters(
      client,
      [](void* to, const std::int64_t* ids, std::size_t count, const quarvel_error* error) {
        Say(to, std::to_string(count) + ": " + std::to_string(ids[1]), error);
      },
      &said);
  const auto done = [](void* to, const quarvel_error* error) { Say(to, "done", error); };
  for (int i = 0; i < 3; ++i) {
    quarvel_send_message(client, nullptr, QUARVEL_KIND_VOLUME, 0, nullptr, 0, done, &said);
  }
  service_.answer(true);
  service_.answer(65535);
  service_.answer(Dictionary{{"reporterID", 7}, {"serviceType", 3}});
  service_.answer(List{7, -8});
  service_.answer(nullptr);
  // The reason has 447 octets; a character that would be cut is left out.
  const std::string reason = std::string(446, 'x') + "äää";
  const Dictionary error{{"domain", "tarnwick.audio.reporting"},
                         {"code", 1},
                         {"userInfo", Dictionary{{"reason", reason}}}};
  service_.send(FakeService::response(service_.call(), error, nullptr));
  ASSERT_TRUE(service_.receive());
  service_.hangUp();
  while (quarvel_dispatch(client, -1) == QUARVEL_OK) continue;
  EXPECT_THAT(said, ElementsAre("true", "65535", "7 3", "2: -8", "done",
                                "tarnwick.audio.reporting 1 100: " + std::string(446, 'x'),
                                HasSubstr("quarvel.client 2 2: The service has closed")));
}

TEST_F(CTest, SynchronousCallsHaveResultsAndErrors) {
  quarvel_client* client = connect();
  std::jthread service([this] {
    for (int i = 0; i < 5; ++i) service_.answer(true);
    service_.answer(3);
    service_.receive();  // the start
    service_.answer(Dictionary{{"reporterID", 0}, {"serviceType", 65535}});
    service_.answer(Dictionary{{"reporterID", 7}, {"serviceType", 3}});
    service_.answer(List{7, 8, 9});
    service_.answer(nullptr);
    service_.receive();
    service_.receive();
    service_.hangUp();
  });
  const PayloadHandle payload = NewPayload();
  const quarvel_status done[] = {
      quarvel_sync_create_reporting_session(client, 7, -1, nullptr),
      quarvel_sync_set_service_type(client, 3, 7, -1, nullptr),
      quarvel_sync_set_configuration(client, payload.get(), 7, -1, nullptr),
      quarvel_sync_stop_reporting_session_for_id(client, 7, -1, nullptr),
      quarvel_sync_destroy_reporting_session(client, 7, -1, nullptr),
  };
  EXPECT_THAT(done, ::testing::Each(QUARVEL_OK));
  std::uint16_t type = 0;
  EXPECT_EQ(quarvel_sync_get_service_name_for_reporter_id(client, 7, -1, &type, nullptr),
            QUARVEL_OK);
  EXPECT_EQ(type, 3);
  bool known = true;
  EXPECT_EQ(
      quarvel_sync_start_reporting_session_for_id(client, 7, nullptr, nullptr, -1, &known, nullptr),
      QUARVEL_OK);
  EXPECT_FALSE(known);
  EXPECT_EQ(quarvel_sync_reporter_id(client, 7, -1, &known, nullptr, nullptr), QUARVEL_OK);
  EXPECT_TRUE(known);
  std::int64_t ids[2] = {};
  std::size_t count = 0;
  EXPECT_EQ(quarvel_sync_get_all_reporters(client, -1, ids, 2, &count, nullptr), QUARVEL_OK);
  EXPECT_THAT(ids, ElementsAre(7, 8));
  EXPECT_EQ(count, 3U);
  EXPECT_EQ(quarvel_sync_send_message(client, payload.get(), 1, 1, ids, 2, -1, nullptr),
            QUARVEL_OK);
  quarvel_error error;
  EXPECT_EQ(quarvel_sync_create_reporting_session(client, 7, 1, &error), QUARVEL_TIMED_OUT);
  EXPECT_STREQ(error.domain, "quarvel.client");
  EXPECT_EQ(quarvel_sync_kill_service(client, -1, &error), QUARVEL_OK);
  EXPECT_EQ(error.status, QUARVEL_OK);
  EXPECT_FALSE(quarvel_connected(client));
}

TEST_F(CTest, BadArgumentsAreRefusedBeforeAnythingHappens) {
  quarvel_client* client = nullptr;
  quarvel_error error;
  EXPECT_EQ(quarvel_client_new(&options_, nullptr, &error), QUARVEL_INVALID_ARGUMENT);
  options_.size = 0;
  EXPECT_EQ(quarvel_client_new(&options_, &client, &error), QUARVEL_INVALID_ARGUMENT);
  // As a program has them that was built before there was more than the path.
  options_.size = offsetof(quarvel_options, driver);
  connect();
  EXPECT_EQ(quarvel_descriptor(client_.get()), -1) << "the driver is not among its options";
  options_.socket_path = "/nowhere/reporting.sock";
  EXPECT_EQ(quarvel_client_new(&options_, &client, &error), QUARVEL_UNREACHABLE);
  EXPECT_THAT(error.reason, HasSubstr("/nowhere/reporting.sock"));
  EXPECT_EQ(client, nullptr);

  EXPECT_EQ(quarvel_create_reporting_session(nullptr, 7, nullptr, nullptr),
            QUARVEL_INVALID_ARGUMENT);
  EXPECT_EQ(quarvel_sync_create_reporting_session(nullptr, 7, -1, &error),
            QUARVEL_INVALID_ARGUMENT);
  const PayloadHandle payload = NewPayload();
  quarvel_payload_open_list(payload.get(), "open");
  EXPECT_EQ(quarvel_send_message(client_.get(), payload.get(), 1, 1, nullptr, 0, nullptr, nullptr),
            QUARVEL_INVALID_PAYLOAD);
  EXPECT_EQ(quarvel_sync_set_configuration(client_.get(), payload.get(), 7, -1, &error),
            QUARVEL_INVALID_PAYLOAD);
  EXPECT_EQ(error.status, QUARVEL_INVALID_PAYLOAD);
  EXPECT_EQ(quarvel_realtime_new(nullptr, 7, nullptr), nullptr);
  quarvel_client_free(nullptr);
  quarvel_payload_free(nullptr);
  quarvel_realtime_free(nullptr);
  EXPECT_FALSE(service_.hasInput());
}

class CPayload : public CTest {
 protected:
  CPayload() { connect(); }
  std::string sent() {
    EXPECT_EQ(quarvel_set_configuration(client_.get(), payload_.get(), 7, nullptr, nullptr),
              QUARVEL_OK);
    const Value call = service_.call();
    return JsonText((*(*call.list())[2].list())[0]);
  }

  const PayloadHandle payload_ = NewPayload();
};

TEST_F(CPayload, HoldsEveryKindOfValueAndContainersInContainers) {
  quarvel_payload* payload = payload_.get();
  quarvel_payload_nil(payload, "nil");
  quarvel_payload_boolean(payload, "boolean", true);
  quarvel_payload_integer(payload, "integer", -1);
  quarvel_payload_unsigned(payload, "unsigned", UINT64_MAX);
  quarvel_payload_real(payload, "real", 0.5);
  quarvel_payload_string(payload, "string", "ä");
  quarvel_payload_bytes(payload, "bytes", "\0\1", 2);
  quarvel_payload_date(payload, "date", 1);
  quarvel_payload_open_list(payload, "list");
  quarvel_payload_integer(payload, nullptr, 1);
  quarvel_payload_open_dictionary(payload, nullptr);
  quarvel_payload_number_key(payload, -5);
  quarvel_payload_boolean(payload, nullptr, false);
  quarvel_payload_close(payload);
  quarvel_payload_open_list(payload, nullptr);
  quarvel_payload_close(payload);
  EXPECT_EQ(quarvel_payload_status(payload), QUARVEL_INVALID_PAYLOAD) << "a list is open";
  EXPECT_EQ(quarvel_payload_close(payload), QUARVEL_OK);
  EXPECT_EQ(sent(),
            R"({"nil":null,"boolean":true,"integer":-1,"unsigned":18446744073709551615,"real":0.5,)"
            R"("string":"ä","bytes":"AAE=","date":"1970-01-01T00:00:00.000001Z",)"
            R"("list":[1,{"-5":false},[]]})");
  quarvel_payload_integer(payload, "integer", 2);
  EXPECT_THAT(sent(), HasSubstr(R"("integer":2})")) << "the last of equal keys";
  quarvel_payload_clear(payload);
  EXPECT_EQ(sent(), "{}");
  EXPECT_EQ(quarvel_payload_assign(payload, "\x81\xa1k\x01", 4), QUARVEL_OK);
  quarvel_payload_integer(payload, "more", 2);
  EXPECT_EQ(sent(), R"({"k":1,"more":2})");
}

TEST_F(CPayload, AnErrorStays) {
  using P = quarvel_payload*;
  quarvel_payload* payload = payload_.get();
  const struct {
    const char* name;
    quarvel_status (*step)(P);
  } faults[] = {
      {"no key", [](P p) { return quarvel_payload_integer(p, nullptr, 1); }},
      {"key not UTF-8", [](P p) { return quarvel_payload_integer(p, "\xff", 1); }},
      {"text not UTF-8", [](P p) { return quarvel_payload_string(p, "k", "\xff"); }},
      {"key in a list",
       [](P p) {
         quarvel_payload_open_list(p, "list");
         return quarvel_payload_integer(p, "k", 1);
       }},
      {"two keys",
       [](P p) {
         quarvel_payload_number_key(p, 1);
         return quarvel_payload_integer(p, "k", 1);
       }},
      {"a key without a value",
       [](P p) {
         quarvel_payload_number_key(p, 1);
         return quarvel_payload_status(p);
       }},
      {"nothing to close", quarvel_payload_close},
      {"year 10000", [](P p) { return quarvel_payload_date(p, "k", 253'402'300'800'000'000); }},
      {"too deep",
       [](P p) {
         quarvel_status status = QUARVEL_OK;
         for (int i = 0; i < 30; ++i) status = quarvel_payload_open_dictionary(p, "k");
         return status;
       }},
      {"no dictionary", [](P p) { return quarvel_payload_assign(p, "\x90", 1); }},
      {"cut short", [](P p) { return quarvel_payload_assign(p, "\x81\xa1k", 3); }},
      {"bytes behind it", [](P p) { return quarvel_payload_assign(p, "\x80\x80", 2); }},
      {"of another extension",
       [](P p) { return quarvel_payload_assign(p, "\x81\xa1k\xd4\x05\x00", 6); }},
  };
  for (const auto& [name, step] : faults) {
    quarvel_payload_clear(payload);
    EXPECT_EQ(step(payload), QUARVEL_INVALID_PAYLOAD) << name;
    EXPECT_EQ(quarvel_payload_status(payload), QUARVEL_INVALID_PAYLOAD) << name;
    quarvel_payload_clear(payload);
    EXPECT_EQ(quarvel_payload_status(payload), QUARVEL_OK) << name;
  }
  for (int i = 0; i < 29; ++i) quarvel_payload_open_dictionary(payload, "k");
  for (int i = 0; i < 29; ++i) quarvel_payload_close(payload);
  EXPECT_EQ(quarvel_payload_status(payload), QUARVEL_OK);
}

TEST_F(CTest, ConnectionChangesAndRealtimeLossesReachTheirCallbacks) {
  struct Seen {
    std::vector<quarvel_connection_change> changes;
    std::string reason;
    quarvel_realtime_loss lost{};
  } seen;
  options_.reconnect = true;
  options_.first_delay_ms = 1;
  options_.context = &seen;
  options_.connection_changed = [](void* context, const quarvel_connection_change* change) {
    auto* to = static_cast<Seen*>(context);
    to->changes.push_back(*change);
    to->reason += change->reason;
  };
  quarvel_client* client = connect();
  quarvel_create_reporting_session(client, 7, nullptr, nullptr);
  ASSERT_TRUE(service_.receive());

  quarvel_realtime_options options{};
  options.size = sizeof options;
  options.records = 2;
  options.record_bytes = 64;
  options.no_loss_message = true;
  options.context = &seen;
  options.lost = [](void* context, const quarvel_realtime_loss* loss) {
    static_cast<Seen*>(context)->lost = *loss;
  };
  const std::unique_ptr<quarvel_realtime, Free> reporter(quarvel_realtime_new(client, 7, &options));
  EXPECT_TRUE(quarvel_realtime_begin(reporter.get(), QUARVEL_KIND_PLAYBACK, QUARVEL_TYPE_SETUP));
  quarvel_realtime_boolean(reporter.get(), "b", true);
  quarvel_realtime_integer(reporter.get(), "i", -1);
  quarvel_realtime_unsigned(reporter.get(), "u", 1);
  quarvel_realtime_real(reporter.get(), "r", 0.5);
  quarvel_realtime_string(reporter.get(), "s", "x");
  quarvel_realtime_date(reporter.get(), "d", 0);
  EXPECT_TRUE(quarvel_realtime_send(reporter.get()));
  EXPECT_TRUE(quarvel_realtime_begin(reporter.get(), 1, 1));
  EXPECT_TRUE(quarvel_realtime_send(reporter.get()));
  EXPECT_FALSE(quarvel_realtime_begin(reporter.get(), 1, 1));
  quarvel_realtime_integer(reporter.get(), "nowhere", 1);
  EXPECT_FALSE(quarvel_realtime_send(reporter.get()));
  quarvel_realtime_stop(reporter.get());
  EXPECT_THAT(call(), HasSubstr(R"([{"b":true,"i":-1,"u":1,"r":0.5,"s":"x",)"
                                R"("d":"1970-01-01T00:00:00.000000Z"},3,3,[7]])"));
  std::uint64_t sent = 0;
  quarvel_realtime_statistics(reporter.get(), &sent, nullptr);
  EXPECT_EQ(sent, 2U);
  EXPECT_EQ(seen.lost.full, 1U);

  service_.hangUp();
  while (seen.changes.size() < 2) quarvel_dispatch(client, -1);
  EXPECT_FALSE(seen.changes[0].restored);
  EXPECT_TRUE(seen.changes[1].restored);
  EXPECT_EQ(seen.changes[1].sessions, 1U);
  EXPECT_THAT(seen.reason, HasSubstr("closed the connection"));
}

}  // namespace
}  // namespace quarvel
