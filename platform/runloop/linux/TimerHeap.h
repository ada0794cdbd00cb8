// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <memory>
#include <utility>
#include <vector>

namespace brenvik {

// The base class of the items in a TimerHeap. Times are nanoseconds of the owner's clock.
struct TimerHeapItem {
  std::uint64_t next = 0;    // due from here on
  std::uint64_t leeway = 0;  // may be late by this much

 private:
  template <typename Item>
  friend class TimerHeap;
  static constexpr std::size_t kNowhere = std::numeric_limits<std::size_t>::max();
  std::uint64_t latest_ = 0;
  std::uint64_t order_ = 0;
  std::size_t place_ = kNowhere;
};

// Orders timers by the latest time at which each must fire; equal ones in the order in which they were added.
// The loop wakes at the earliest of those times and also fires the timers that are due by then. An item is in
// at most one heap. One thread only.
template <typename Item>
class TimerHeap {
 public:
  bool isEmpty() const noexcept { return heap_.empty(); }
  std::size_t size() const noexcept { return heap_.size(); }
  // The timer that must fire first. Precondition: the heap is not empty.
  const std::shared_ptr<Item>& first() const noexcept { return heap_.front(); }
  // The latest time at which that timer must fire; UINT64_MAX if there is none.
  std::uint64_t wakeUp() const noexcept {
    return heap_.empty() ? std::numeric_limits<std::uint64_t>::max() : base(0).latest_;
  }

  // Adds an item, whose times stay as they are until it is removed or moved. May throw std::bad_alloc.
  void add(std::shared_ptr<Item> item) {
    heap_.push_back(std::move(item));
    place(heap_.size() - 1);
    base(heap_.size() - 1).order_ = ++lastOrder_;
    settle(heap_.size() - 1);
  }

  // Removes an item; does nothing if it is not in the heap.
  void remove(Item& item) noexcept {
    const std::size_t at = static_cast<TimerHeapItem&>(item).place_;
    if (at == TimerHeapItem::kNowhere) return;
    static_cast<TimerHeapItem&>(item).place_ = TimerHeapItem::kNowhere;
    std::shared_ptr<Item> removed = std::move(heap_[at]);  // goes when the heap is in order again
    if (at + 1 != heap_.size()) {
      heap_[at] = std::move(heap_.back());
      place(at);
    }
    heap_.pop_back();
    if (at < heap_.size()) settle(at);
  }

  // Changes the time of an item in the heap. It is ordered after items with the same time.
  void move(Item& item, std::uint64_t next) noexcept {
    item.next = next;
    static_cast<TimerHeapItem&>(item).order_ = ++lastOrder_;
    settle(static_cast<TimerHeapItem&>(item).place_);
  }

 private:
  TimerHeapItem& base(std::size_t at) const noexcept { return *heap_[at]; }
  void place(std::size_t at) noexcept { base(at).place_ = at; }
  bool isBefore(std::size_t a, std::size_t b) const noexcept {
    return std::pair(base(a).latest_, base(a).order_) < std::pair(base(b).latest_, base(b).order_);
  }
  void exchange(std::size_t a, std::size_t b) noexcept {
    std::swap(heap_[a], heap_[b]);
    place(a);
    place(b);
  }
  void settle(std::size_t at) noexcept {
    TimerHeapItem& item = base(at);
    constexpr std::uint64_t kEver = std::numeric_limits<std::uint64_t>::max();
    item.latest_ = item.leeway > kEver - item.next ? kEver : item.next + item.leeway;
    for (; at > 0 && isBefore(at, (at - 1) / 2); at = (at - 1) / 2) exchange(at, (at - 1) / 2);
    for (;;) {
      const std::size_t left = 2 * at + 1;
      std::size_t first = at;
      if (left < heap_.size() && isBefore(left, first)) first = left;
      if (left + 1 < heap_.size() && isBefore(left + 1, first)) first = left + 1;
      if (first == at) return;
      exchange(at, first);
      at = first;
    }
  }

  std::vector<std::shared_ptr<Item>> heap_;
  std::uint64_t lastOrder_ = 0;
};

}  // namespace brenvik
