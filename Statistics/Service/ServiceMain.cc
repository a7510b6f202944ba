#include "Statistics/Service/ServiceMain.h"

#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "platform/ServiceListener.h"

namespace quarvel {

int ServiceMain() {
  const auto delegate = ZQReportingServiceDelegate::create();
  ServiceListener& listener = ProcessServiceListener();
  listener.setDelegate(delegate);
  listener.resume();
  return 0;
}

}  // namespace quarvel
