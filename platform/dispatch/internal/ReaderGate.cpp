#include "platform/dispatch/internal/ReaderGate.h"

namespace larder {

bool ReaderGate::drained() const noexcept {
  for (const Slot& slot : slots_) {
    if (slot.readers.load(std::memory_order_seq_cst) != 0) {
      return false;
    }
  }
  return true;
}

std::size_t ReaderGate::assignSlot() noexcept {
  // Part of the per-thread bookkeeping: it only spreads threads over slots.
  static std::atomic<std::size_t> nextSlot{0};
  return nextSlot.fetch_add(1, std::memory_order_relaxed) % kSlotCount;
}

}  // namespace larder
