#include "platform/Condition.h"

#include "linux/Service.h"

namespace quarvel {

std::shared_ptr<Condition> CreateCondition() {
  return Service::current().queues().createCondition();
}

}  // namespace quarvel
