#include "platform/linux/work/BlockingScope.h"

#include "platform/linux/work/Pool.h"

namespace quarvel {

BlockingScope::BlockingScope() {
  Pool::beginBlocking();
}

BlockingScope::~BlockingScope() {
  Pool::endBlocking();
}

}  // namespace quarvel
