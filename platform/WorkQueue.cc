#include "platform/WorkQueue.h"

#include <cassert>

namespace quarvel {

void WorkQueue::assertCurrent() const {
  assert(isCurrent());
}

}  // namespace quarvel
