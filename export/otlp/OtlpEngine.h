#pragma once

#include <string>

#include "export/ExportDevice.h"
#include "export/ExportEngine.h"
#include "export/otlp/HttpPoster.h"
#include "export/otlp/OtlpSettings.h"

namespace quarvel {

/// Any collector that takes logs by OTLP/HTTP, in the protocol's JSON form.
///
/// An answer that the protocol calls retryable (429, 502, 503, 504) has the batch wait. So do those
/// that speak of the connection and not of the batch (a redirect, 401, 403, 404, ...): no row is
/// given up because a token has run out. Any other refusal is about the batch, and for ever.
class OtlpEngine final : public ExportEngine {
 public:
  OtlpEngine(const OtlpSettings& settings, ExportDevice device);

  [[nodiscard]] Delivery deliver(const ExportBatch& batch) override;
  void rest() override { poster_.rest(); }
  void stop() override { poster_.stop(); }
  void resume() override { poster_.resume(); }

 private:
  const ExportDevice device_;
  const bool gzip_;
  HttpPoster poster_;
};

}  // namespace quarvel
