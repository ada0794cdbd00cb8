// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string_view>
#include <utility>

#include "platform/plist/Node.h"
#include "platform/plist/PropertyList.h"

// Functions here throw std::bad_alloc; the public ones catch it.
namespace brenvik::plist {

struct Foreign {
  Node node;
  const Document* owner;  // counted once for this record
  const Foreign* next;
};

// The memory of one or many values: an arena that only grows, and is freed as a whole when the last handle
// goes. Counting is atomic; everything else happens before the document is shared.
class Document {
 public:
  // With one reference. `expected` bytes fit in the first block.
  static Document* create(std::size_t expected);

  void retain() const noexcept { references_.fetch_add(1, std::memory_order_relaxed); }
  // Frees the document, and those it alone kept alive, without recursion.
  static void release(const Document* document) noexcept;

  // Aligned for Node.
  void* allocate(std::size_t bytes) {
    cursor_ += -reinterpret_cast<std::uintptr_t>(cursor_) & 7;  // may pass the end, where there is no room
    if (room() < bytes) grow(bytes);
    return std::exchange(cursor_, cursor_ + bytes);
  }
  // Unaligned, for text. What is not used of it can be given back at once with trim().
  char* allocateText(std::size_t bytes) {
    if (room() < bytes) grow(bytes);
    return std::exchange(cursor_, cursor_ + bytes);
  }
  void trim(char* endOfUsed) noexcept { cursor_ = endOfUsed; }
  const char* copyText(const char* bytes, std::size_t size) {
    char* const copy = allocateText(size);
    if (size != 0) std::memcpy(copy, bytes, size);
    return copy;
  }
  // A node for a value of another document, which lives at least as long as this one from now on.
  Node adopt(const Node& node, const Document* owner);

 private:
  struct Block {
    Block* next;
  };

  Document() = default;
  ~Document() = default;
  std::size_t room() const noexcept { return cursor_ > end_ ? 0 : static_cast<std::size_t>(end_ - cursor_); }
  void grow(std::size_t bytes);

  mutable std::atomic<std::uint32_t> references_{1};
  char* cursor_ = nullptr;
  char* end_ = nullptr;
  Block* blocks_ = nullptr;  // behind the first, which this object itself begins
  std::size_t total_ = 0;
  const Foreign* foreign_ = nullptr;
  mutable const Document* nextDead_ = nullptr;
};

// Keeps a new document until a value takes it over.
class DocumentHolder {
 public:
  explicit DocumentHolder(std::size_t expected) : document_(Document::create(expected)) {}
  DocumentHolder(const DocumentHolder&) = delete;
  DocumentHolder& operator=(const DocumentHolder&) = delete;
  ~DocumentHolder() {
    if (document_ != nullptr) Document::release(document_);
  }
  Document& operator*() const noexcept { return *document_; }
  Document* operator->() const noexcept { return document_; }
  Document* handOver() noexcept { return std::exchange(document_, nullptr); }

 private:
  Document* document_;
};

// What a node stands for: itself, or the value of another document.
inline const Node& resolved(const Node& node) noexcept {
  return node.tag == Tag::foreign ? node.foreign->node : node;
}

// Keyed with a secret of this process: nobody can prepare keys that collide.
std::uint64_t hashOf(const char* bytes, std::size_t size) noexcept;
inline void setKeyHash(Node& key) noexcept {
  const std::uint64_t hash = hashOf(key.text, key.size);
  for (int i = 0; i < 3; ++i) key.hash[i] = static_cast<std::uint8_t>(hash >> (8 * i));
}
inline std::uint32_t keyHash(const Node& key) noexcept {
  return key.hash[0] | std::uint32_t{key.hash[1]} << 8 | std::uint32_t{key.hash[2]} << 16;
}
inline bool sameKey(const Node& one, const Node& other) noexcept {
  return std::memcmp(&one, &other, 8) == 0 && std::memcmp(one.text, other.text, one.size) == 0;
}

inline constexpr std::uint32_t kLargestUnindexed = 16;
// Bytes that a dictionary of so many entries takes in the arena, index included.
std::size_t dictionaryBytes(std::size_t entries) noexcept;
// Makes a dictionary of key, value, key, value ... at the start of dictionaryBytes(entries) bytes, keys with
// their hashes set. Of equal keys the first place and the last value stand.
Node finishDictionary(Node* pairs, std::size_t entries) noexcept;
// The place of the key (with its hash set) among the children, or null.
const Node* findKey(const Node& dictionary, const Node& key) noexcept;

struct Access {
  static const Node& node(const PropertyList& value) noexcept { return value.node_; }
  static const Document* owner(const PropertyList& value) noexcept { return value.owner_; }
  // Takes over one reference to the owner, if there is one.
  static PropertyList make(const Node& node, const Document* owner) noexcept {
    PropertyList value;
    value.node_ = node;
    value.owner_ = owner;
    return value;
  }
};

}  // namespace brenvik::plist
