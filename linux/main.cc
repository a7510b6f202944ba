#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "platform/ServiceListener.h"

int main() {
  const auto delegate = quarvel::ZQReportingServiceDelegate::create();
  quarvel::ServiceListener& listener = quarvel::ProcessServiceListener();
  listener.setDelegate(delegate);
  listener.resume();
  return 0;
}
