#include <chrono>
#include <string_view>
#include <utility>

#include <quarvel/realtime.hpp>

#include "client/RealtimeRing.h"
#include "client/c/Boundary.h"

using quarvel::RealtimeReporter;
using quarvel::c::Guard;

namespace {

quarvel_realtime_loss AsLoss(const RealtimeReporter::Loss& loss) {
  return {loss.full, loss.tooLarge, loss.invalid, loss.unsent};
}

RealtimeReporter::Options AsOptions(const quarvel_realtime_options& given) {
  RealtimeReporter::Options options;
  if (given.records > 0) options.records = given.records;
  if (given.record_bytes > 0) options.recordBytes = given.record_bytes;
  if (given.interval_ms > 0) options.interval = std::chrono::milliseconds(given.interval_ms);
  if (given.no_loss_message) options.lossMessage.reset();
  if (given.lost != nullptr) {
    options.lost = [lost = given.lost,
                    context = given.context](const RealtimeReporter::Loss& loss) {
      const quarvel_realtime_loss told = AsLoss(loss);
      lost(context, &told);
    };
  }
  return options;
}

}  // namespace

/// The reporter behind C's opaque pointer; its open record is the ring's.
struct quarvel_realtime {
  RealtimeReporter reporter;

  quarvel_realtime(quarvel_client& client, int64_t session, RealtimeReporter::Options options)
      : reporter(client.client, session, std::move(options)) {}
  [[nodiscard]] quarvel::RealtimeRing& ring() const { return *reporter.ring_; }
};

quarvel_realtime* quarvel_realtime_new(quarvel_client* client, int64_t reporter_id,
                                       const quarvel_realtime_options* options) {
  quarvel_realtime_options read;
  if (client == nullptr || !quarvel::c::Read(options, read)) return nullptr;
  quarvel_realtime* made = nullptr;
  Guard([&] {
    made = new quarvel_realtime(*client, reporter_id, AsOptions(read));
    return QUARVEL_OK;
  });
  return made;
}

void quarvel_realtime_free(quarvel_realtime* reporter) {
  Guard([&] {
    delete reporter;
    return QUARVEL_OK;
  });
}

void quarvel_realtime_start(quarvel_realtime* reporter) {
  if (reporter == nullptr) return;
  Guard([&] {
    reporter->reporter.start();
    return QUARVEL_OK;
  });
}

void quarvel_realtime_stop(quarvel_realtime* reporter) {
  if (reporter == nullptr) return;
  Guard([&] {
    reporter->reporter.stop();
    return QUARVEL_OK;
  });
}

void quarvel_realtime_statistics(const quarvel_realtime* reporter, uint64_t* sent,
                                 quarvel_realtime_loss* lost) {
  if (reporter == nullptr) return;
  const auto statistics = reporter->reporter.statistics();
  if (sent != nullptr) *sent = statistics.sent;
  if (lost != nullptr) *lost = AsLoss(statistics.lost);
}

bool quarvel_realtime_begin(quarvel_realtime* reporter, uint32_t category, uint16_t type) {
  return reporter->ring().begin(category, type);
}

void quarvel_realtime_boolean(quarvel_realtime* reporter, const char* key, bool value) {
  reporter->ring().boolean(key, value);
}

void quarvel_realtime_integer(quarvel_realtime* reporter, const char* key, int64_t value) {
  reporter->ring().integer(key, value);
}

void quarvel_realtime_unsigned(quarvel_realtime* reporter, const char* key, uint64_t value) {
  reporter->ring().unsignedInteger(key, value);
}

void quarvel_realtime_real(quarvel_realtime* reporter, const char* key, double value) {
  reporter->ring().real(key, value);
}

void quarvel_realtime_string(quarvel_realtime* reporter, const char* key, const char* text) {
  reporter->ring().string(key, text);
}

void quarvel_realtime_date(quarvel_realtime* reporter, const char* key, int64_t microseconds) {
  reporter->ring().date(key, quarvel::Date(std::chrono::microseconds(microseconds)));
}

bool quarvel_realtime_send(quarvel_realtime* reporter) {
  return reporter->ring().commit();
}
