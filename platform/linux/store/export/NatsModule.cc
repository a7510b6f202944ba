#include "platform/linux/store/export/EngineModule.h"
#include "platform/linux/store/export/NatsEngine.h"

extern "C" __attribute__((visibility("default"))) quarvel::ExportEngine* QuarvelMakeEngine(
    const quarvel::Configuration::Agent& agent, const quarvel::ExportDevice& device) {
  return new quarvel::NatsEngine(agent.nats, device);
}
