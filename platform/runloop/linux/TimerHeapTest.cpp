// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/runloop/linux/TimerHeap.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <memory>
#include <random>
#include <vector>

namespace brenvik {
namespace {

struct Item : TimerHeapItem {
  Item(std::uint64_t at, int n, std::uint64_t late = 0) : number(n) {
    next = at;
    leeway = late;
  }
  int number;
};
using Pointer = std::shared_ptr<Item>;

Pointer add(TimerHeap<Item>& heap, std::uint64_t at, int number, std::uint64_t leeway = 0) {
  auto item = std::make_shared<Item>(at, number, leeway);
  heap.add(item);
  return item;
}

std::vector<int> takeAll(TimerHeap<Item>& heap) {
  std::vector<int> numbers;
  while (!heap.isEmpty()) {
    EXPECT_EQ(heap.wakeUp(), heap.first()->next + heap.first()->leeway);
    numbers.push_back(heap.first()->number);
    heap.remove(*heap.first());
  }
  return numbers;
}

TEST(TimerHeapTest, AnEmptyOneNeverWakesAnybody) {
  TimerHeap<Item> heap;
  EXPECT_TRUE(heap.isEmpty());
  EXPECT_EQ(heap.wakeUp(), UINT64_MAX);
}

TEST(TimerHeapTest, TheFirstIsTheEarliestAndEqualOnesKeepTheirOrder) {
  TimerHeap<Item> heap;
  int number = 0;
  for (const std::uint64_t at : {5U, 1U, 3U, 1U, 5U, 3U, 1U}) add(heap, at, number++);
  EXPECT_EQ(takeAll(heap), (std::vector{1, 3, 6, 2, 5, 0, 4}));
}

TEST(TimerHeapTest, OneThatMayBeLateComesWhenItMustAndWakesNobodyEarlier) {
  TimerHeap<Item> heap;
  add(heap, 10, 1, 100);
  EXPECT_EQ(heap.wakeUp(), 110U);
  add(heap, 50, 2);
  EXPECT_EQ(heap.wakeUp(), 50U);
  EXPECT_EQ(takeAll(heap), (std::vector{2, 1}));
}

TEST(TimerHeapTest, ALeewayBeyondAllTimeNeverWakesAnybody) {
  TimerHeap<Item> heap;
  add(heap, 10, 1, UINT64_MAX);
  EXPECT_EQ(heap.wakeUp(), UINT64_MAX);
  EXPECT_FALSE(heap.isEmpty());
}

TEST(TimerHeapTest, RemovingTwiceOrWhatWasNeverInDoesNothing) {
  TimerHeap<Item> heap;
  const auto in = add(heap, 1, 1);
  add(heap, 2, 2);
  Item stranger(0, 3);
  heap.remove(stranger);
  heap.remove(*in);
  heap.remove(*in);
  EXPECT_EQ(takeAll(heap), std::vector{2});
}

TEST(TimerHeapTest, WhatItAloneOwnedGoesWhenItIsRemovedAndMayRemoveOthers) {
  TimerHeap<Item> heap;
  const auto other = add(heap, 2, 2);
  struct Owner : Item {
    using Item::Item;
    ~Owner() { heap->remove(*victim); }
    TimerHeap<Item>* heap = nullptr;
    Item* victim = nullptr;
  };
  auto owner = std::make_shared<Owner>(1, 1);
  owner->heap = &heap;
  owner->victim = other.get();
  heap.add(std::move(owner));
  heap.remove(*heap.first());
  EXPECT_TRUE(heap.isEmpty());
}

// Against a plain list, sorted anew each time.
TEST(TimerHeapTest, ManyThatComeGoAndMoveStayInOrder) {
  std::mt19937 random(17);
  TimerHeap<Item> heap;
  std::vector<Pointer> list;  // in the order in which they were added or moved
  const auto pick = [&] { return static_cast<std::size_t>(random() % list.size()); };
  for (int step = 0; step < 20000; ++step) {
    const auto what = random() % 5;
    if (what < 2 || list.empty()) {
      list.push_back(add(heap, random() % 1000, step, random() % 3 == 0 ? random() % 1000 : 0));
    } else if (what == 2) {
      const std::size_t at = pick();
      heap.remove(*list[at]);
      list.erase(list.begin() + static_cast<std::ptrdiff_t>(at));
    } else if (what == 3) {
      const std::size_t at = pick();
      heap.move(*list[at], random() % 1000);
      std::rotate(list.begin() + static_cast<std::ptrdiff_t>(at),
                  list.begin() + static_cast<std::ptrdiff_t>(at) + 1, list.end());
    } else {
      heap.remove(*heap.first());
      const auto earliest = std::min_element(
          list.begin(), list.end(),
          [](const Pointer& a, const Pointer& b) { return a->next + a->leeway < b->next + b->leeway; });
      list.erase(earliest);
    }
    ASSERT_EQ(heap.size(), list.size());
    if (list.empty()) continue;
    const auto earliest = std::min_element(list.begin(), list.end(), [](const Pointer& a, const Pointer& b) {
      return a->next + a->leeway < b->next + b->leeway;
    });
    ASSERT_EQ(heap.first(), *earliest) << "at step " << step;
  }
}

}  // namespace
}  // namespace brenvik
