#include "platform/linux/work/BlockingScope.h"

#include "platform/linux/work/HelpScope.h"
#include "platform/linux/work/Pool.h"

namespace quarvel {

BlockingScope::BlockingScope() {
  Pool::beginBlocking();
}

BlockingScope::~BlockingScope() {
  Pool::endBlocking();
}

bool BlockingScope::isAllowed() {
  HelpScope* const help = HelpScope::current();
  if (help == nullptr) return true;
  help->exhaust();
  return false;
}

}  // namespace quarvel
