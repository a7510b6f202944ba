#include "platform/ServiceListener.h"

#include "linux/Service.h"

namespace quarvel {

ServiceListener& ProcessServiceListener() {
  return Service::current().listener();
}

}  // namespace quarvel
