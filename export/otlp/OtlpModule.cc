#include "export/ExportEngine.h"
#include "export/otlp/OtlpEngine.h"

extern "C" __attribute__((visibility("default"))) quarvel::ExportEngine* QuarvelMakeEngine(
    const quarvel::BackendSettings& settings, const quarvel::ExportDevice& device) {
  return new quarvel::OtlpEngine(static_cast<const quarvel::OtlpSettings&>(settings), device);
}
