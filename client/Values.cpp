// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "client/include/brenvik/mobile_helper.h"
#include "platform/base/Utf8.h"
#include "platform/plist/PropertyListCodec.h"

// Values for C programs: handles of property lists. A property list never changes, so a container that is
// being filled keeps its elements beside it, and becomes a property list when it is asked for.

using brenvik::PropertyList;

struct bvmh_value {
  using Entries = std::vector<std::pair<std::string, PropertyList>>;

  explicit bvmh_value(PropertyList of) noexcept : value(std::move(of)) {}

  PropertyList value;  // as it was before the elements below
  bool isChanged = false;
  std::vector<PropertyList> elements;  // of a changed array, all of them
  Entries entries;                     // of a changed dictionary; of equal keys the last stands
  std::size_t tidyAt = 0;              // so many entries that equal keys may be the most of them
  std::string text;                    // that was handed out
};

namespace {

constexpr double kUnixTimeOf2001 = 978307200;
constexpr std::size_t kMinTidied = 64;

using Type = PropertyList::Type;

// Nothing is thrown at a C program: runs the work, and returns `onExhaustion` when memory runs out in it.
template <class Result, class Work>
Result guarded(Result onExhaustion, const Work& work) noexcept {
  try {
    return work();
  } catch (const std::bad_alloc&) {
    return onExhaustion;
  }
}

// Makes what was changed a property list again. False when memory runs out; then it is as it was.
bool settle(bvmh_value* handle) noexcept {
  if (!handle->isChanged) return true;
  return guarded(false, [handle] {
    PropertyList made = handle->value.is(Type::array) ? PropertyList::array(handle->elements)
                                                      : PropertyList::dictionary(handle->entries);
    if (!made) return false;  // more elements than a property list can have: the handle keeps them
    handle->value = std::move(made);
    handle->isChanged = false;
    handle->elements.clear();
    handle->entries.clear();
    return true;
  });
}

// For functions that only read: that the handle keeps its value in another form is nobody's concern.
const PropertyList& settled(const bvmh_value* handle) noexcept {
  static const PropertyList kNone{};
  return handle != nullptr && settle(const_cast<bvmh_value*>(handle)) ? handle->value : kNone;
}

bvmh_value* handleOf(PropertyList value) noexcept {
  return value ? new (std::nothrow) bvmh_value(std::move(value)) : nullptr;
}

constexpr bvmh_value* kNoHandle = nullptr;
constexpr const char* kNoText = nullptr;

bool isContainer(const bvmh_value* handle, Type type) noexcept {
  return handle != nullptr && handle->value.is(type);
}

// Throws std::bad_alloc.
void beginChange(bvmh_value& handle) {
  if (handle.isChanged) return;
  const std::size_t count = handle.value.size();
  if (handle.value.is(Type::array)) {
    handle.elements.reserve(count + 1);
    for (std::size_t i = 0; i < count; ++i) handle.elements.push_back(handle.value.at(i));
  } else {
    handle.entries.reserve(count + 1);
    for (std::size_t i = 0; i < count; ++i)
      handle.entries.emplace_back(std::string(handle.value.keyAt(i)), handle.value.at(i));
    handle.tidyAt = std::max(kMinTidied, 2 * count);
  }
  handle.isChanged = true;
}

// The change as a whole or not at all.
template <class Change>
std::int32_t change(bvmh_value& handle, const Change& apply) noexcept {
  try {
    beginChange(handle);
    apply();
    return BVMH_OK;
  } catch (const std::bad_alloc&) {
    if (!handle.isChanged) {
      handle.elements.clear();
      handle.entries.clear();
    }
    return BVMH_ERROR_NO_MEMORY;
  }
}

template <class Optional, class Out>
bool store(const Optional& found, Out* out) noexcept {
  if (!found || out == nullptr) return false;
  *out = *found;
  return true;
}

}  // namespace

extern "C" {

bvmh_value* bvmh_value_new_boolean(bool value) { return handleOf(PropertyList::boolean(value)); }
bvmh_value* bvmh_value_new_integer(int64_t value) { return handleOf(PropertyList::integer(value)); }
bvmh_value* bvmh_value_new_unsigned(uint64_t value) { return handleOf(PropertyList::unsignedInteger(value)); }
bvmh_value* bvmh_value_new_real(double value) { return handleOf(PropertyList::real(value)); }
bvmh_value* bvmh_value_new_date(double seconds) {
  return handleOf(PropertyList::date(seconds - kUnixTimeOf2001));
}
bvmh_value* bvmh_value_new_array(void) { return handleOf(PropertyList::array({})); }
bvmh_value* bvmh_value_new_dictionary(void) { return handleOf(PropertyList::dictionary({})); }

bvmh_value* bvmh_value_new_text(const char* text) {
  if (text == nullptr) return nullptr;
  return guarded(kNoHandle, [text] { return handleOf(PropertyList::string(text)); });
}

bvmh_value* bvmh_value_new_data(const void* bytes, size_t size) {
  if (bytes == nullptr && size != 0) return nullptr;
  const std::span data(static_cast<const std::byte*>(bytes), size);
  return guarded(kNoHandle, [data] { return handleOf(PropertyList::data(data)); });
}

bvmh_value* bvmh_value_copy(const bvmh_value* value) { return handleOf(settled(value)); }

void bvmh_value_free(bvmh_value* value) { delete value; }

int32_t bvmh_value_append(bvmh_value* array, bvmh_value* element) {
  if (element == nullptr || element == array) return BVMH_ERROR_INVALID_ARGUMENT;
  const std::unique_ptr<bvmh_value> owned(element);
  if (!isContainer(array, Type::array)) return BVMH_ERROR_INVALID_ARGUMENT;
  if (!settle(element)) return BVMH_ERROR_NO_MEMORY;
  return change(*array, [&] { array->elements.push_back(element->value); });
}

int32_t bvmh_value_set(bvmh_value* dictionary, const char* key, bvmh_value* value) {
  if (value == nullptr || value == dictionary) return BVMH_ERROR_INVALID_ARGUMENT;
  const std::unique_ptr<bvmh_value> owned(value);
  if (!isContainer(dictionary, Type::dictionary) || key == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  if (!settle(value)) return BVMH_ERROR_NO_MEMORY;
  if (!brenvik::isValidUtf8(key)) return BVMH_ERROR_INVALID_ARGUMENT;
  if (dictionary->isChanged && dictionary->entries.size() >= dictionary->tidyAt && !settle(dictionary))
    return BVMH_ERROR_NO_MEMORY;
  return change(*dictionary, [&] { dictionary->entries.emplace_back(key, value->value); });
}

bvmh_value_type bvmh_value_type_of(const bvmh_value* value) {
  if (value == nullptr || !value->value) return BVMH_VALUE_NONE;
  switch (value->value.type()) {
    case Type::boolean:
      return BVMH_VALUE_BOOLEAN;
    case Type::integer:
      return BVMH_VALUE_INTEGER;
    case Type::real:
      return BVMH_VALUE_REAL;
    case Type::string:
      return BVMH_VALUE_TEXT;
    case Type::data:
      return BVMH_VALUE_DATA;
    case Type::date:
      return BVMH_VALUE_DATE;
    case Type::array:
      return BVMH_VALUE_ARRAY;
    case Type::dictionary:
      return BVMH_VALUE_DICTIONARY;
  }
  return BVMH_VALUE_NONE;
}

size_t bvmh_value_count(const bvmh_value* value) { return settled(value).size(); }

bvmh_value* bvmh_value_at(const bvmh_value* value, size_t index) {
  return handleOf(settled(value).at(index));
}

const char* bvmh_value_key_at(bvmh_value* dictionary, size_t index) {
  const PropertyList& value = settled(dictionary);
  if (!value.is(Type::dictionary) || index >= value.size()) return nullptr;
  return guarded(kNoText, [&] {
    dictionary->text = value.keyAt(index);
    return dictionary->text.c_str();
  });
}

bvmh_value* bvmh_value_find(const bvmh_value* dictionary, const char* key) {
  return key == nullptr ? nullptr : handleOf(settled(dictionary).find(key));
}

bool bvmh_value_get_boolean(const bvmh_value* value, bool* out) {
  return store(settled(value).asBoolean(), out);
}

bool bvmh_value_get_integer(const bvmh_value* value, int64_t* out) {
  return store(settled(value).asInteger(), out);
}

bool bvmh_value_get_unsigned(const bvmh_value* value, uint64_t* out) {
  return store(settled(value).asUnsignedInteger(), out);
}

bool bvmh_value_get_real(const bvmh_value* value, double* out) { return store(settled(value).asReal(), out); }

bool bvmh_value_get_date(const bvmh_value* value, double* out) {
  if (!store(settled(value).asDate(), out)) return false;
  *out += kUnixTimeOf2001;
  return true;
}

const char* bvmh_value_get_text(bvmh_value* value, size_t* length) {
  if (length != nullptr) *length = 0;
  const auto found = settled(value).asString();
  if (!found) return nullptr;
  return guarded(kNoText, [&] {
    value->text = *found;
    if (length != nullptr) *length = value->text.size();
    return value->text.c_str();
  });
}

const void* bvmh_value_get_data(const bvmh_value* value, size_t* size) {
  if (size != nullptr) *size = 0;
  const auto found = settled(value).asData();
  if (!found) return nullptr;
  if (size != nullptr) *size = found->size();
  // Empty data has no bytes of its own, but it is data.
  return found->data() == nullptr ? static_cast<const void*>("") : found->data();
}

int32_t bvmh_value_read(const void* bytes, size_t size, bvmh_value** value) {
  if (value == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  *value = nullptr;
  if (bytes == nullptr && size != 0) return BVMH_ERROR_INVALID_ARGUMENT;
  const std::span document(static_cast<const std::byte*>(bytes), size);
  return guarded<std::int32_t>(BVMH_ERROR_NO_MEMORY, [&] {
    PropertyList read = brenvik::parsePropertyList(document);
    if (!read) return BVMH_ERROR_NOT_A_VALUE;
    *value = handleOf(std::move(read));
    return *value == nullptr ? BVMH_ERROR_NO_MEMORY : BVMH_OK;
  });
}

int32_t bvmh_value_write(const bvmh_value* value, bvmh_region* bytes) {
  if (bytes == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  *bytes = bvmh_region{};
  if (value == nullptr) return BVMH_ERROR_INVALID_ARGUMENT;
  const PropertyList& written = settled(value);
  if (!written) return BVMH_ERROR_NO_MEMORY;
  return guarded<std::int32_t>(BVMH_ERROR_NO_MEMORY, [&] {
    const auto made = serializePropertyList(written, brenvik::PropertyListFormat::binary);
    if (!made) return BVMH_ERROR_NOT_A_VALUE;
    void* copy = std::malloc(made->size());
    if (copy == nullptr) return BVMH_ERROR_NO_MEMORY;
    // Bytes, not a text.
    // NOLINTNEXTLINE(bugprone-not-null-terminated-result)
    std::memcpy(copy, made->data(), made->size());
    *bytes = {copy, made->size(), copy, nullptr};
    return BVMH_OK;
  });
}

}  // extern "C"
