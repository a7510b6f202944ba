#include "queues/CallTracker.h"

namespace quarvel {
namespace {

// The running call's or block's reference, and which of the two runs.
thread_local const CallRef* currentCall = nullptr;
thread_local CallScope::Of currentOf = CallScope::Of::call;

}  // namespace

CallRef CallRef::current() {
  if (currentCall == nullptr) return {};
  return {currentCall->tracker_, currentOf == CallScope::Of::call};
}

CallScope::CallScope(Of of, const CallRef& call) : previous_(currentCall), previousOf_(currentOf) {
  currentCall = &call;
  currentOf = of;
}

CallScope::~CallScope() {
  currentCall = previous_;
  currentOf = previousOf_;
}

}  // namespace quarvel
