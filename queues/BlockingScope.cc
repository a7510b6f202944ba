#include "queues/BlockingScope.h"

#include "queues/InlineRunner.h"
#include "queues/Pool.h"

namespace quarvel {

BlockingScope::BlockingScope() {
  Pool::beginBlocking();
}

BlockingScope::~BlockingScope() {
  Pool::endBlocking();
}

bool BlockingScope::isAllowed() {
  InlineRunner* const help = InlineRunner::current();
  if (help == nullptr) return true;
  help->exhaust();
  return false;
}

}  // namespace quarvel
