#include "platform/linux/work/Voucher.h"

namespace quarvel {
namespace {

// The hold that the running block was queued with.
thread_local const VoucherHold* currentHold = nullptr;

}  // namespace

VoucherHold VoucherHold::current() {
  return currentHold == nullptr ? VoucherHold() : VoucherHold(currentHold->voucher_);
}

VoucherScope::VoucherScope(const VoucherHold& hold) : previous_(currentHold) {
  currentHold = &hold;
}

VoucherScope::~VoucherScope() {
  currentHold = previous_;
}

}  // namespace quarvel
