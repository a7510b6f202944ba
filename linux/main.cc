#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "linux/ProcessExporters.h"
#include "platform/ServiceListener.h"
#include "system/Configuration.h"

int main() {
  quarvel::Configuration::setRemoteBackends(quarvel::RemoteBackends());
  const auto delegate = quarvel::ZQReportingServiceDelegate::create();
  quarvel::ServiceListener& listener = quarvel::ProcessServiceListener();
  listener.setDelegate(delegate);
  listener.resume();
  return 0;
}
