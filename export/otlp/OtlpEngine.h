#pragma once

#include <string>

#include "export/ExportEngine.h"
#include "export/ExportSettings.h"
#include "export/otlp/HttpPoster.h"
#include "export/otlp/OtlpSettings.h"

namespace quarvel {

/// Sends rows to any collector that takes logs by OTLP/HTTP, in the protocol's JSON form.
///
/// Owned and used as `ExportEngine` says. Memory: one request, compressed when configured.
class OtlpEngine final : public ExportEngine {
 public:
  /// Opens no connection before the first delivery.
  OtlpEngine(const OtlpSettings& settings, ExportDevice device);

  [[nodiscard]] Delivery deliver(const ExportBatch& batch) override;
  void disconnect() override { poster_.disconnect(); }
  void stop() override { poster_.stop(); }
  void resume() override { poster_.resume(); }

 private:
  const ExportDevice device_;
  const bool gzip_;  // requests are compressed
  HttpPoster poster_;
};

/// The outcome of a batch of `rows` rows by the collector's response. Pure.
///
/// The protocol calls 429, 502, 503 and 504 retryable: the rows wait. They also wait after a status
/// that concerns the connection and not the rows (a redirect, 401, 403, 404, ...), since no row may
/// be given up because a token has run out. Any other status of 400 and above refuses the rows for
/// ever.
[[nodiscard]] Delivery DeliveryFromResponse(const HttpPoster::Response& response, std::size_t rows);

}  // namespace quarvel
