#include <fmt/ranges.h>
#include <quarvel/quarvel.h>

#include "tests/client/ClientTesting.h"

namespace quarvel {
namespace {

struct Free {
  void operator()(quarvel_client* client) const { quarvel_client_free(client); }
  void operator()(quarvel_payload* payload) const { quarvel_payload_free(payload); }
  void operator()(quarvel_realtime* reporter) const { quarvel_realtime_free(reporter); }
};
using PayloadHandle = std::unique_ptr<quarvel_payload, Free>;

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
  quarvel_client* c = connect();
  const PayloadHandle payload(quarvel_payload_new());
  quarvel_payload* p = payload.get();
  quarvel_payload_integer(p, "n", 1);
  const std::int64_t ids[] = {7, -8};
  const std::string send = R"(sendMessage:withCategory:andType:forReportingIDs:reply:",[)";
  constexpr std::nullptr_t n = nullptr;
  const std::pair<quarvel_status, std::string> sent[] = {
      {quarvel_create_reporting_session(c, 7, n, n), R"(createReportingSession:reply:",[7])"},
      {quarvel_set_service_type(c, QUARVEL_SERVICE_TELEPHONY, 7, n, n),
       R"(setServiceType:reportingSession:reply:",[2,7])"},
      {quarvel_get_service_name_for_reporter_id(c, 7, n, n),
       R"(getServiceNameForReporterID:reply:",[7])"},
      {quarvel_set_configuration(c, p, 7, n, n),
       R"(setConfiguration:forReporterID:reply:",[{"n":1},7])"},
      {quarvel_set_configuration(c, n, 7, n, n),
       R"(setConfiguration:forReporterID:reply:",[null,7])"},
      {quarvel_start_reporting_session_for_id(c, 7, n, n),
       R"(startReportingSessionForID:reply:",[7])"},
      {quarvel_send_message(c, p, QUARVEL_COMPONENT_TOOLBOX | QUARVEL_KIND_ERROR,
                            QUARVEL_TYPE_UNKNOWN, ids, 2, n, n),
       send + R"({"n":1},2147483656,65535,[7,-8]])"},
      {quarvel_send_message(c, n, QUARVEL_KIND_VOLUME, QUARVEL_TYPE_GENERIC, ids, 0, n, n),
       send + "null,11,0,[]]"},
      {quarvel_send_message(c, n, QUARVEL_KIND_VOLUME, QUARVEL_TYPE_GENERIC, n, 0, n, n),
       send + "null,11,0,null]"},
      {quarvel_stop_reporting_session_for_id(c, 7, n, n),
       R"(stopReportingSessionForID:reply:",[7])"},
      {quarvel_destroy_reporting_session(c, 7, n, n), R"(destroyReportingSession:reply:",[7])"},
      {quarvel_reporter_id(c, 7, n, n), R"(reporterID:valid:",[7])"},
      {quarvel_get_all_reporters(c, n, n), R"(getAllReporters:",[])"},
      {quarvel_kill_service(c, n, n), R"(killService:",[])"},
  };
  for (const auto& [status, frame] : sent) {
    EXPECT_EQ(status, QUARVEL_OK) << frame;
    EXPECT_EQ(call(), "[2,\"" + frame + "]");
  }
}

/// Adds replies with these results to a list of texts.
template <class... Results>
struct Notes {
  static void add(void* notes, Results... results, const quarvel_error* error) {
    static_cast<std::vector<std::string>*>(notes)->push_back(
        error == nullptr ? fmt::format("{}", fmt::join(std::tuple(results...), " "))
                         : fmt::format("{} {} {}: {}", error->domain, error->code,
                                       static_cast<int>(error->status), error->reason));
  }
};

TEST_F(CTest, EveryKindOfReplyArrives) {
  quarvel_client* client = connect();
  std::vector<std::string> notes;
  quarvel_create_reporting_session(client, 7, Notes<bool>::add, &notes);
  quarvel_get_service_name_for_reporter_id(client, 7, Notes<std::uint16_t>::add, &notes);
  quarvel_reporter_id(client, 7, Notes<std::int64_t, std::uint16_t>::add, &notes);
  const auto add = [](void* to, const std::int64_t* ids, std::size_t n,
                      const quarvel_error* error) {
    Notes<std::size_t, std::int64_t>::add(to, n, ids[1], error);
  };
  quarvel_get_all_reporters(client, add, &notes);
  for (int i = 0; i < 3; ++i) {
    quarvel_send_message(client, nullptr, QUARVEL_KIND_VOLUME, 0, nullptr, 0, Notes<>::add, &notes);
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
  EXPECT_THAT(notes, ElementsAre("true", "65535", "7 3", "2 -8", "",
                                 "tarnwick.audio.reporting 1 100: " + std::string(446, 'x'),
                                 HasSubstr("quarvel.client 2 2: The service has closed")));
}

TEST_F(CTest, SynchronousCallsHaveResultsAndErrors) {
  quarvel_client* c = connect();
  std::jthread service([this] {
    for (int i = 0; i < 5; ++i) service_.answer(true);
    service_.answer(3);
    const Value start = service_.call();
    service_.answer(Dictionary{{"reporterID", 0}, {"serviceType", 65535}});
    const Value secondStart = service_.call();
    service_.answer(Dictionary{{"reporterID", 7}, {"serviceType", 3}});
    service_.reply(start, true);
    service_.reply(secondStart, false);
    service_.answer(Dictionary{{"reporterID", 7}, {"serviceType", 3}});
    service_.answer(List{7, 8, 9});
    service_.answer(nullptr);
    service_.receive();
    service_.receive();
    service_.hangUp();
  });
  const PayloadHandle payload(quarvel_payload_new());
  constexpr std::nullptr_t n = nullptr;
  const auto add = Notes<bool>::add;
  std::uint16_t type = 0;
  bool known[] = {true, false, false};
  std::vector<std::string> stopped;
  std::int64_t ids[2] = {};
  std::size_t count = 0;
  const quarvel_status done[] = {
      quarvel_sync_create_reporting_session(c, 7, -1, n),
      quarvel_sync_set_service_type(c, 3, 7, -1, n),
      quarvel_sync_set_configuration(c, payload.get(), 7, -1, n),
      quarvel_sync_stop_reporting_session_for_id(c, 7, -1, n),
      quarvel_sync_destroy_reporting_session(c, 7, -1, n),
      quarvel_sync_get_service_name_for_reporter_id(c, 7, -1, &type, n),
      quarvel_sync_start_reporting_session_for_id(c, 7, add, &stopped, -1, &known[0], n),
      quarvel_sync_start_reporting_session_for_id(c, 7, add, &stopped, -1, &known[1], n),
      quarvel_sync_reporter_id(c, 7, -1, &known[2], n, n),
      quarvel_sync_get_all_reporters(c, -1, ids, 2, &count, n),
      quarvel_sync_send_message(c, payload.get(), 1, 1, ids, 2, -1, n),
  };
  EXPECT_THAT(done, ::testing::Each(QUARVEL_OK));
  EXPECT_EQ(type, 3);
  EXPECT_THAT(known, ElementsAre(false, true, true));
  EXPECT_THAT(stopped, ElementsAre("true", "false"));
  EXPECT_THAT(ids, ElementsAre(7, 8));
  EXPECT_EQ(count, 3U);
  quarvel_error error;
  EXPECT_EQ(quarvel_sync_create_reporting_session(c, 7, 1, &error), QUARVEL_TIMED_OUT);
  EXPECT_STREQ(error.domain, "quarvel.client");
  EXPECT_EQ(quarvel_sync_kill_service(c, -1, &error), QUARVEL_OK);
  EXPECT_EQ(error.status, QUARVEL_OK);
  EXPECT_FALSE(quarvel_connected(c));
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

  const quarvel_status refused[] = {quarvel_create_reporting_session(nullptr, 7, nullptr, nullptr),
                                    quarvel_sync_create_reporting_session(nullptr, 7, -1, &error)};
  EXPECT_THAT(refused, ::testing::Each(QUARVEL_INVALID_ARGUMENT));
  const PayloadHandle payload(quarvel_payload_new());
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

  const PayloadHandle payload_{quarvel_payload_new()};
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
  const auto tooDeep = [](P p) {
    for (int i = 0; i < 29; ++i) quarvel_payload_open_dictionary(p, "k");
    return quarvel_payload_open_dictionary(p, "k");
  };
  const auto keyInAList = [](P p) {
    quarvel_payload_open_list(p, "list");
    return quarvel_payload_integer(p, "k", 1);
  };
  const auto twoKeys = [](P p) {
    quarvel_payload_number_key(p, 1);
    return quarvel_payload_integer(p, "k", 1);
  };
  const auto keyAlone = [](P p) {
    quarvel_payload_number_key(p, 1);
    return quarvel_payload_status(p);
  };
  const std::pair<const char*, quarvel_status (*)(P)> faults[] = {
      {"no key", [](P p) { return quarvel_payload_integer(p, nullptr, 1); }},
      {"key not UTF-8", [](P p) { return quarvel_payload_integer(p, "\xff", 1); }},
      {"text not UTF-8", [](P p) { return quarvel_payload_string(p, "k", "\xff"); }},
      {"key in a list", keyInAList},
      {"two keys", twoKeys},
      {"a key without a value", keyAlone},
      {"nothing to close", quarvel_payload_close},
      {"year 10000", [](P p) { return quarvel_payload_date(p, "k", 253'402'300'800'000'000); }},
      {"too deep", tooDeep},
      {"no dictionary", [](P p) { return quarvel_payload_assign(p, "\x90", 1); }},
      {"cut short", [](P p) { return quarvel_payload_assign(p, "\x81\xa1k", 3); }},
      {"bytes behind it", [](P p) { return quarvel_payload_assign(p, "\x80\x80", 2); }},
      {"extension", [](P p) { return quarvel_payload_assign(p, "\x81\xa1k\xd4\x05\x00", 6); }},
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
  const std::unique_ptr<quarvel_realtime, Free> owned(quarvel_realtime_new(client, 7, &options));
  quarvel_realtime* reporter = owned.get();
  EXPECT_TRUE(quarvel_realtime_begin(reporter, QUARVEL_KIND_PLAYBACK, QUARVEL_TYPE_SETUP));
  quarvel_realtime_boolean(reporter, "b", true);
  quarvel_realtime_integer(reporter, "i", -1);
  quarvel_realtime_unsigned(reporter, "u", 1);
  quarvel_realtime_real(reporter, "r", 0.5);
  quarvel_realtime_string(reporter, "s", "x");
  quarvel_realtime_date(reporter, "d", 0);
  EXPECT_TRUE(quarvel_realtime_send(reporter));
  EXPECT_TRUE(quarvel_realtime_begin(reporter, 1, 1));
  EXPECT_TRUE(quarvel_realtime_send(reporter));
  EXPECT_FALSE(quarvel_realtime_begin(reporter, 1, 1));
  quarvel_realtime_integer(reporter, "nowhere", 1);
  EXPECT_FALSE(quarvel_realtime_send(reporter));
  quarvel_realtime_stop(reporter);
  EXPECT_THAT(call(), HasSubstr(R"([{"b":true,"i":-1,"u":1,"r":0.5,"s":"x",)"
                                R"("d":"1970-01-01T00:00:00.000000Z"},3,3,[7]])"));
  std::uint64_t sent = 0;
  quarvel_realtime_statistics(reporter, &sent, nullptr);
  EXPECT_EQ(sent, 2U);
  EXPECT_EQ(seen.lost.full, 1U);

  service_.hangUp();
  while (seen.changes.size() < 2) quarvel_dispatch(client, -1);
  EXPECT_TRUE(!seen.changes[0].restored && seen.changes[1].restored);
  EXPECT_EQ(seen.changes[1].sessions, 1U);
  EXPECT_THAT(seen.reason, HasSubstr("closed the connection"));
}

}  // namespace
}  // namespace quarvel
