#include "queues/CallTracker.h"

namespace quarvel {
namespace {

// The hold that the running call or block has, and which of the two it is.
thread_local const CallRef* currentHold = nullptr;
thread_local CallScope::Of currentOf = CallScope::Of::call;

}  // namespace

CallRef CallRef::current() {
  if (currentHold == nullptr) return {};
  return {currentHold->tracker_, currentOf == CallScope::Of::call};
}

CallScope::CallScope(Of of, const CallRef& hold) : previous_(currentHold), previousOf_(currentOf) {
  currentHold = &hold;
  currentOf = of;
}

CallScope::~CallScope() {
  currentHold = previous_;
  currentOf = previousOf_;
}

}  // namespace quarvel
