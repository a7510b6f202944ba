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
constexpr std::size_t kQuotedBytes = 200;  // of a response's body, in the ledger and the log

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

std::string Gzip(const std::string& text) {
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

/// The begin of a response's body as one line of ASCII, for the ledger and the log.
std::string QuoteBody(const std::string& body) {
  if (body.empty()) return {};
  std::string quoted = body.substr(0, kQuotedBytes);
  for (char& character : quoted) {
    if (static_cast<unsigned char>(character) < 0x20 ||
        static_cast<unsigned char>(character) > 0x7e)
      character = ' ';
  }
  return fmt::format(" and says \"{}\"", quoted);
}

/// Whether the collector refuses the rows themselves, so that sending them again is of no use.
bool RefusesBatch(long status) {
  constexpr std::array kRetryLater{401L, 403L, 404L, 405L, 407L, 408L,
                                   415L, 429L, 502L, 503L, 504L};
  return status >= 400 && std::ranges::find(kRetryLater, status) == kRetryLater.end();
}

Delivery AcceptedDelivery(const HttpPoster::Response& response, std::size_t rows) {
  const auto partial = ReadOtlpResponse(response.body);
  if (!partial) {  // for example the log-in page of a public network
    return {.remainder = Delivery::Remainder::again,
            .reason = fmt::format("{} is answered, but not by OTLP", response.status)};
  }
  return {.taken = rows,
          .reason = partial.value().message,
          .droppedByEngine = std::min(partial.value().rejected, rows)};
}

}  // namespace

OtlpEngine::OtlpEngine(const OtlpSettings& settings, ExportDevice device)
    : device_(std::move(device)), gzip_(settings.gzip), poster_(OptionsOf(settings, device_)) {}

Delivery OtlpEngine::deliver(const ExportBatch& batch) {
  const std::string request = OtlpRequest(batch, device_);
  return DeliveryFromResponse(poster_.post(gzip_ ? Gzip(request) : request), batch.rows.size());
}

Delivery DeliveryFromResponse(const HttpPoster::Response& response, std::size_t rows) {
  if (response.stopped) return {.remainder = Delivery::Remainder::stopped};
  if (response.status == 0)
    return {.remainder = Delivery::Remainder::again, .reason = response.failure};
  if (response.status / 100 == 2) return AcceptedDelivery(response, rows);
  Delivery delivery{.reason =
                        fmt::format("it answers {}{}", response.status, QuoteBody(response.body))};
  if (RefusesBatch(response.status)) {
    delivery.remainder = Delivery::Remainder::refused;
    delivery.refused = rows;
  } else {
    delivery.remainder = Delivery::Remainder::again;
    delivery.after = response.retryAfter;
  }
  return delivery;
}

}  // namespace quarvel
