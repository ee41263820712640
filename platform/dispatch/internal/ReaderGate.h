#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>

namespace larder {

// Lets synchronous readers of a concurrent queue in and out without writing any cache line that
// another reader thread writes. Each thread counts itself in one of a fixed set of padded slots;
// a barrier raises a flag and then waits until every slot has drained.
//
// The protocol relies on sequential consistency between the two sides:
//  - a reader increments its slot, then reads the flag: if it is raised, the reader undoes its
//    increment and queues behind the barrier instead;
//  - a barrier raises the flag, then reads the slots.
// Either the barrier sees the reader's increment (and waits for it), or the reader sees the flag
// (and backs off): both cannot miss each other. Symmetrically, a reader leaving decrements its
// slot and then reads the flag; when it is raised the reader must tell the queue, since the
// barrier may have seen the slot busy and be waiting for it to drain.
class ReaderGate {
 public:
  static constexpr std::size_t kSlotCount = 32;

  // Slots are handed out to threads round-robin on first use, so the first kSlotCount threads
  // that read never share one; beyond that, sharing is still correct, only slower.
  [[nodiscard]] static std::size_t slotOfThisThread() noexcept {
    if (threadSlot_ == kUnassigned) {
      threadSlot_ = assignSlot();
    }
    return threadSlot_;
  }

  // False when a barrier is pending: the caller must take the ordered path.
  [[nodiscard]] bool tryEnter(std::size_t slot) noexcept {
    std::atomic<std::uint32_t>& readers = slots_[slot].readers;
    readers.fetch_add(1, std::memory_order_seq_cst);
    if (!barrierPending_.load(std::memory_order_seq_cst)) {
      return true;
    }
    readers.fetch_sub(1, std::memory_order_seq_cst);
    return false;
  }

  // True when a barrier is pending and may be waiting for this reader to leave.
  [[nodiscard]] bool leave(std::size_t slot) noexcept {
    slots_[slot].readers.fetch_sub(1, std::memory_order_seq_cst);
    return barrierPending_.load(std::memory_order_seq_cst);
  }

  void setBarrierPending(bool pending) noexcept {
    barrierPending_.store(pending, std::memory_order_seq_cst);
  }

  // Meaningful only while the barrier flag is raised: then no reader can enter unnoticed.
  [[nodiscard]] bool drained() const noexcept;

 private:
  static constexpr std::size_t kUnassigned = ~std::size_t{0};
  // Two lines: some CPUs prefetch cache lines in adjacent pairs.
  static constexpr std::size_t kPadding = 128;

  struct alignas(kPadding) Slot {
    std::atomic<std::uint32_t> readers{0};
  };

  static std::size_t assignSlot() noexcept;

  alignas(kPadding) std::atomic<bool> barrierPending_{false};
  std::array<Slot, kSlotCount> slots_{};

  static inline thread_local std::size_t threadSlot_ = kUnassigned;
};

}  // namespace larder
