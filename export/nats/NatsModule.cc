#include "export/ExportEngine.h"
#include "export/nats/NatsEngine.h"

extern "C" __attribute__((visibility("default"))) quarvel::ExportEngine* QuarvelMakeEngine(
    const quarvel::BackendSettings& settings, const quarvel::ExportDevice& device) {
  return new quarvel::NatsEngine(static_cast<const quarvel::NatsSettings&>(settings), device);
}
