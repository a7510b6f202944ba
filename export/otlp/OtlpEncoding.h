#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "export/ExportBatch.h"
#include "export/ExportSettings.h"

namespace quarvel {

/// A batch as one ExportLogsServiceRequest in OTLP's JSON form (opentelemetry.io, "OTLP
/// Specification", JSON Protobuf Encoding): one log record for each row. 64-bit integers are
/// decimal text there. Reporter IDs, which may be any 64-bit number, are text attributes; an
/// integer above the signed range is text too, since the protocol has no such number.
[[nodiscard]] std::string OtlpRequest(const ExportBatch& batch, const ExportDevice& device);

/// Result of an ExportLogsServiceResponse.
struct OtlpPartialSuccess {
  std::size_t rejected = 0;  // rows that the collector did not keep
  std::string message;       // its reason, or a warning when it kept all
};
/// Reads one in the JSON form; an empty body means that every row was kept. Errors: domain
/// "quarvel.otlp", when the body is no such response.
[[nodiscard]] Result<OtlpPartialSuccess> ReadOtlpResponse(std::string_view body);

}  // namespace quarvel
