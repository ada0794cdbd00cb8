// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "client/include/brenvik/mobile_helper.h"

namespace {

// Asks a value for everything, to some depth and breadth, as a careless program does.
void lookThrough(bvmh_value* value, int depth) {
  bool boolean = false;
  std::int64_t integer = 0;
  std::uint64_t large = 0;
  double real = 0;
  std::size_t size = 0;
  const int answers = bvmh_value_get_boolean(value, &boolean) + bvmh_value_get_integer(value, &integer) +
                      bvmh_value_get_real(value, &real) + bvmh_value_get_date(value, &real);
  (void)bvmh_value_get_unsigned(value, &large);
  const char* text = bvmh_value_get_text(value, &size);
  if (text != nullptr && text[size] != '\0') std::abort();
  (void)bvmh_value_get_data(value, &size);
  if (answers > 1 || (answers == 1 && text != nullptr)) std::abort();
  const std::size_t count = bvmh_value_count(value);
  for (std::size_t i = 0; depth > 0 && i < count && i < 8; ++i) {
    bvmh_value* const element = bvmh_value_at(value, i);
    if (element == nullptr) std::abort();
    const char* key = bvmh_value_key_at(value, i);
    if ((key != nullptr) != (bvmh_value_type_of(value) == BVMH_VALUE_DICTIONARY)) std::abort();
    lookThrough(element, depth - 1);
    bvmh_value_free(element);
  }
}

}  // namespace

// Bytes of any kind as a value, which then is changed, written and read again.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  bvmh_value* value = nullptr;
  if (bvmh_value_read(data, size, &value) != BVMH_OK) {
    if (value != nullptr) std::abort();
    return 0;
  }
  lookThrough(value, 4);
  const std::size_t before = bvmh_value_count(value);
  const bool isArray = bvmh_value_type_of(value) == BVMH_VALUE_ARRAY;
  if (bvmh_value_append(value, bvmh_value_new_integer(1)) == BVMH_OK &&
      (!isArray || bvmh_value_count(value) != before + 1)) {
    std::abort();
  }
  (void)bvmh_value_set(value, "key", bvmh_value_copy(value));
  bvmh_region region{};
  if (bvmh_value_write(value, &region) == BVMH_OK) {
    bvmh_value* again = nullptr;
    // What is too large as XML now is refused by the reader; the rest comes back.
    if (bvmh_value_read(region.bytes, region.size, &again) == BVMH_OK &&
        bvmh_value_count(again) != bvmh_value_count(value)) {
      std::abort();
    }
    bvmh_value_free(again);
    bvmh_region_free(&region);
  }
  bvmh_value_free(value);
  return 0;
}
