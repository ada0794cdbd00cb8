// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/base/fakes/FailingMalloc.h"
#include "platform/sqlite/Sqlite.h"

#ifndef BRENVIK_MALLOC_IS_TAKEN

namespace brenvik {
namespace {

// In a process of its own, where the library has not been loaded yet. Exits with 0 when the library was
// loaded or its lack of memory was told.
[[noreturn]] void loadWithoutMemory(long first, FailingMalloc::HowMany howMany) {
  bool lackedMemory = false;
  const SqliteFunctions* functions = nullptr;
  {
    const FailingMalloc failing(first, howMany);
    functions = sqlite(&lackedMemory);
  }
  if (functions == nullptr && !lackedMemory) std::exit(1);
  // And with memory it is loaded after all.
  std::exit(sqlite(&lackedMemory) != nullptr && !lackedMemory ? 0 : 2);
}

TEST(SqliteMemoryTest, ALibraryThatMemoryDoesNotSufficeForIsNotTakenForAMissingOne) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  constexpr long kAllocations = 24;  // loading it takes about twelve
  for (long first = 0; first < kAllocations; ++first) {
    for (const auto howMany : {FailingMalloc::HowMany::one, FailingMalloc::HowMany::all}) {
      EXPECT_EXIT(loadWithoutMemory(first, howMany), testing::ExitedWithCode(0), "") << first;
    }
  }
}

}  // namespace
}  // namespace brenvik

#endif
