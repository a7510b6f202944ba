#include "export/otlp/OtlpEngine.h"

#include <fmt/format.h>
#include <zlib.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <utility>

#include "export/otlp/OtlpEncoding.h"

namespace quarvel {

namespace {

constexpr std::string_view kPath = "/v1/logs";
constexpr std::size_t kQuotedBytes = 200;  // of what an engine says of itself

std::string AddressOf(std::string endpoint) {
  while (endpoint.ends_with('/')) endpoint.pop_back();
  return endpoint.ends_with(kPath) ? endpoint : endpoint.append(kPath);
}

HttpPoster::Options OptionsOf(const OtlpSettings& settings, const ExportDevice& device) {
  HttpPoster::Options options{AddressOf(settings.endpoint), settings.headers, settings.tls,
                              settings.connect, settings.timeout};
  options.headers["Content-Type"] = "application/json";
  options.headers["User-Agent"] = "quarveld/" + device.version;
  if (settings.gzip) options.headers["Content-Encoding"] = "gzip";
  return options;
}

std::string Gzipped(const std::string& text) {
  constexpr int kGzipWindow = 15 + 16;
  constexpr int kMemory = 8;
  z_stream stream{};
  if (deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, kGzipWindow, kMemory,
                   Z_DEFAULT_STRATEGY) != Z_OK) {
    std::abort();  // out of memory
  }
  std::string out(deflateBound(&stream, static_cast<uLong>(text.size())), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  deflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  deflateEnd(&stream);
  return out;
}

/// One line of what the engine says, for the ledger and the log.
std::string Quoted(const std::string& body) {
  if (body.empty()) return {};
  std::string quoted = body.substr(0, kQuotedBytes);
  for (char& character : quoted) {
    if (static_cast<unsigned char>(character) < 0x20 ||
        static_cast<unsigned char>(character) > 0x7e)
      character = ' ';
  }
  return fmt::format(" and says \"{}\"", quoted);
}

bool IsAboutTheBatch(long status) {
  constexpr std::array kNotAboutTheBatch{401L, 403L, 404L, 405L, 407L, 408L,
                                         415L, 429L, 502L, 503L, 504L};
  return status >= 400 && std::ranges::find(kNotAboutTheBatch, status) == kNotAboutTheBatch.end();
}

Delivery Taken(const HttpPoster::Answer& answer, std::size_t rows) {
  const auto said = ReadOtlpResponse(answer.body);
  if (!said) {  // whoever answers for a network that is not reached, say
    return {.rest = Delivery::Rest::again,
            .reason = fmt::format("{} is answered, but not by OTLP", answer.status)};
  }
  return {.taken = rows,
          .reason = said.value().message,
          .droppedByEngine = std::min(said.value().rejected, rows)};
}

}  // namespace

OtlpEngine::OtlpEngine(const OtlpSettings& settings, ExportDevice device)
    : device_(std::move(device)), gzip_(settings.gzip), poster_(OptionsOf(settings, device_)) {}

Delivery OtlpEngine::deliver(const ExportBatch& batch) {
  const std::string request = OtlpRequest(batch, device_);
  const HttpPoster::Answer answer = poster_.post(gzip_ ? Gzipped(request) : request);
  if (answer.stopped) return {.rest = Delivery::Rest::stopped};
  if (answer.status == 0) return {.rest = Delivery::Rest::again, .reason = answer.failure};
  if (answer.status / 100 == 2) return Taken(answer, batch.rows.size());
  Delivery delivery{.reason = fmt::format("it answers {}{}", answer.status, Quoted(answer.body))};
  if (IsAboutTheBatch(answer.status)) {
    delivery.rest = Delivery::Rest::refused;
    delivery.refused = batch.rows.size();
  } else {
    delivery.rest = Delivery::Rest::again;
    delivery.after = answer.retryAfter;
  }
  return delivery;
}

}  // namespace quarvel
