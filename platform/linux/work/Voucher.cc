#include "platform/linux/work/Voucher.h"

namespace quarvel {
namespace {

// The hold that the running call or block has, and which of the two it is.
thread_local const VoucherHold* currentHold = nullptr;
thread_local VoucherScope::Of currentOf = VoucherScope::Of::call;

}  // namespace

VoucherHold VoucherHold::current() {
  if (currentHold == nullptr) return {};
  return {currentHold->voucher_, currentOf == VoucherScope::Of::call};
}

VoucherScope::VoucherScope(Of of, const VoucherHold& hold)
    : previous_(currentHold), previousOf_(currentOf) {
  currentHold = &hold;
  currentOf = of;
}

VoucherScope::~VoucherScope() {
  currentHold = previous_;
  currentOf = previousOf_;
}

}  // namespace quarvel
