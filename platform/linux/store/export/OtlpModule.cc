#include "platform/linux/store/export/EngineModule.h"
#include "platform/linux/store/export/OtlpEngine.h"

extern "C" __attribute__((visibility("default"))) quarvel::ExportEngine* QuarvelMakeEngine(
    const quarvel::Configuration::Agent& agent, const quarvel::ExportDevice& device) {
  return new quarvel::OtlpEngine(agent.otlp, device);
}
