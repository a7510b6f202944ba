#include "export/EngineModule.h"
#include "export/nats/NatsEngine.h"

extern "C" __attribute__((visibility("default"))) quarvel::ExportEngine* QuarvelMakeEngine(
    const quarvel::Configuration::Agent& agent, const quarvel::ExportDevice& device) {
  return new quarvel::NatsEngine(agent.nats, device);
}
