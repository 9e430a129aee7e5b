#include "common/HeldBytes.h"

#include <utility>

namespace qn {

namespace {
thread_local std::shared_ptr<HeldBytes> charged;
}  // namespace

HeldBytes::Charge::Charge(std::shared_ptr<HeldBytes> account)
    : previous_(std::exchange(charged, std::move(account))) {}

HeldBytes::Charge::~Charge() { charged = std::move(previous_); }

const std::shared_ptr<HeldBytes>& HeldBytes::Charge::Current() { return charged; }

}  // namespace qn
