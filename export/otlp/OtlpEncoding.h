#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "export/ExportBatch.h"
#include "export/ExportDevice.h"

namespace quarvel {

/// A batch as one ExportLogsServiceRequest in OTLP's JSON form (opentelemetry.io, "OTLP
/// Specification", JSON Protobuf Encoding): a log record a row. 64-bit integers are decimal text
/// there. Reporter IDs, which may be any 64-bit number, are text attributes; an integer above the
/// signed range is text too, since the protocol has none.
[[nodiscard]] std::string OtlpRequest(const ExportBatch& batch, const ExportDevice& device);

/// What an ExportLogsServiceResponse says.
struct OtlpPartialSuccess {
  std::size_t rejected = 0;
  std::string message;
};
/// Reads one in the JSON form; an empty body says that all is well. Errors: it is none.
[[nodiscard]] Result<OtlpPartialSuccess> ReadOtlpResponse(std::string_view body);

}  // namespace quarvel
