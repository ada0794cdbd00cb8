// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/Document.h"

#include <sys/random.h>

#include <algorithm>
#include <bit>
#include <cstdlib>
#include <new>

namespace brenvik::plist {
namespace {

// Blocks grow with the document up to this, so that little is left unused at the end of a large one.
constexpr std::size_t kLargestStep = std::size_t{256} << 10;
constexpr std::size_t kSmallestStep = 512;

struct Secret {
  std::uint64_t words[2] = {0x9E3779B97F4A7C15ULL, 0xC2B2AE3D27D4EB4FULL};
  Secret() noexcept {
    // Early in boot there may be no randomness yet: the constants then stand alone, and nothing waits.
    std::uint64_t drawn[2];
    if (::getrandom(drawn, sizeof drawn, GRND_NONBLOCK) == ssize_t{sizeof drawn}) {
      words[0] ^= drawn[0];
      words[1] ^= drawn[1];
    }
  }
};

std::uint64_t load64(const char* bytes) noexcept {
  std::uint64_t word;
  std::memcpy(&word, bytes, sizeof word);
  return word;
}

std::uint64_t load32(const char* bytes) noexcept {
  std::uint32_t word;
  std::memcpy(&word, bytes, sizeof word);
  return word;
}

std::uint64_t mix(std::uint64_t one, std::uint64_t other) noexcept {
  __extension__ using Wide = unsigned __int128;
  const Wide product = Wide{one} * other;
  return static_cast<std::uint64_t>(product) ^ static_cast<std::uint64_t>(product >> 64);
}

std::size_t indexSlots(std::size_t entries) noexcept {
  return entries <= kLargestUnindexed ? 0 : std::bit_ceil(entries * 2);
}

// Slots hold an entry's number plus one; 0 is free.
const Node* probe(const Node* pairs, const std::uint32_t* index, std::size_t slots, const Node& key,
                  std::size_t& slot) noexcept {
  for (slot = keyHash(key) & (slots - 1); index[slot] != 0; slot = (slot + 1) & (slots - 1)) {
    const Node* const found = pairs + (std::size_t{index[slot]} - 1) * 2;
    if (sameKey(*found, key)) return found;
  }
  return nullptr;
}

// Drops earlier values of equal keys in a dictionary without an index. Returns the number of entries left.
std::size_t dropRepeatsBySearch(Node* pairs, std::size_t entries) noexcept {
  std::size_t kept = 0;
  // One bit a hash: most dictionaries have no two keys with the same one, and are not searched at all.
  std::uint64_t seen = 0;
  for (std::size_t i = 0; i < entries; ++i) {
    const Node& key = pairs[2 * i];
    const std::uint64_t bit = std::uint64_t{1} << (key.hash[0] & 63);
    std::size_t place = (seen & bit) != 0 ? 0 : kept;
    while (place < kept && !sameKey(pairs[2 * place], key)) ++place;
    seen |= bit;
    if (place == kept) pairs[2 * kept++] = key;
    pairs[2 * place + 1] = pairs[2 * i + 1];
  }
  return kept;
}

// The same, making the index behind the entries.
std::size_t dropRepeatsByIndex(Node* pairs, std::size_t entries) noexcept {
  auto* const index = reinterpret_cast<std::uint32_t*>(pairs + 2 * entries);
  const std::size_t slots = indexSlots(entries);
  std::fill_n(index, slots, 0u);
  std::size_t kept = 0;
  for (std::size_t i = 0; i < entries; ++i) {
    std::size_t slot = 0;
    const Node* const earlier = probe(pairs, index, slots, pairs[2 * i], slot);
    if (earlier != nullptr) {
      pairs[earlier - pairs + 1] = pairs[2 * i + 1];
      continue;
    }
    if (i != kept) {
      pairs[2 * kept] = pairs[2 * i];
      pairs[2 * kept + 1] = pairs[2 * i + 1];
    }
    index[slot] = static_cast<std::uint32_t>(++kept);
  }
  return kept;
}

}  // namespace

std::uint64_t hashOf(const char* bytes, std::size_t size) noexcept {
  static const Secret secret;
  const std::uint64_t key = secret.words[1];
  std::uint64_t state = secret.words[0] ^ size;
  std::size_t left = size;
  for (; left > 16; left -= 16, bytes += 16) state = mix(load64(bytes) ^ key, load64(bytes + 8) ^ state);
  std::uint64_t low = 0;
  std::uint64_t high = 0;
  if (left >= 8) {
    low = load64(bytes);
    high = load64(bytes + left - 8);
  } else if (left >= 4) {
    low = load32(bytes);
    high = load32(bytes + left - 4);
  } else if (left > 0) {
    low = static_cast<unsigned char>(bytes[0]);
    high = static_cast<std::uint64_t>(static_cast<unsigned char>(bytes[left / 2])) << 8 |
           static_cast<unsigned char>(bytes[left - 1]);
  }
  return mix(mix(low ^ key, high ^ state), secret.words[0]);
}

std::size_t dictionaryBytes(std::size_t entries) noexcept {
  return entries * 2 * sizeof(Node) + indexSlots(entries) * sizeof(std::uint32_t);
}

Node finishDictionary(Node* pairs, std::size_t entries) noexcept {
  std::size_t kept = 0;
  if (entries <= kLargestUnindexed) {
    kept = dropRepeatsBySearch(pairs, entries);
  } else {
    kept = dropRepeatsByIndex(pairs, entries);
    // The index is found by the number of entries, so with fewer of them it has another place.
    if (kept != entries && kept > kLargestUnindexed) dropRepeatsByIndex(pairs, kept);
  }
  Node dictionary;
  dictionary.tag = Tag::dictionary;
  dictionary.size = static_cast<std::uint32_t>(kept);
  dictionary.children = kept == 0 ? nullptr : pairs;
  return dictionary;
}

const Node* findKey(const Node& dictionary, const Node& key) noexcept {
  const Node* const pairs = dictionary.children;
  if (dictionary.size <= kLargestUnindexed) {
    for (std::size_t i = 0; i < dictionary.size; ++i) {
      if (sameKey(pairs[2 * i], key)) return pairs + 2 * i;
    }
    return nullptr;
  }
  std::size_t slot = 0;
  return probe(pairs, reinterpret_cast<const std::uint32_t*>(pairs + 2 * std::size_t{dictionary.size}),
               indexSlots(dictionary.size), key, slot);
}

Document* Document::create(std::size_t expected) {
  const std::size_t bytes = sizeof(Document) + expected;
  void* const memory = std::malloc(bytes);
  if (memory == nullptr) throw std::bad_alloc();
  auto* const document = new (memory) Document;
  document->cursor_ = static_cast<char*>(memory) + sizeof(Document);
  document->end_ = static_cast<char*>(memory) + bytes;
  document->total_ = bytes;
  return document;
}

void Document::grow(std::size_t bytes) {
  const std::size_t step = std::max(bytes, std::clamp(total_, kSmallestStep, kLargestStep));
  if (step > SIZE_MAX - sizeof(Block)) throw std::bad_alloc();
  auto* const block = static_cast<Block*>(std::malloc(sizeof(Block) + step));
  if (block == nullptr) throw std::bad_alloc();
  block->next = blocks_;
  blocks_ = block;
  cursor_ = reinterpret_cast<char*>(block + 1);
  end_ = cursor_ + step;
  total_ += step;
}

Node Document::adopt(const Node& node, const Document* owner) {
  auto* const record = new (allocate(sizeof(Foreign))) Foreign{node, owner, foreign_};
  owner->retain();
  foreign_ = record;
  Node standIn;
  standIn.tag = Tag::foreign;
  standIn.foreign = record;
  return standIn;
}

void Document::release(const Document* document) noexcept {
  const Document* dead = nullptr;
  auto drop = [&dead](const Document* one) {
    if (one->references_.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
    one->nextDead_ = dead;
    dead = one;
  };
  drop(document);
  while (dead != nullptr) {
    const Document* const current = dead;
    dead = current->nextDead_;
    for (const Foreign* record = current->foreign_; record != nullptr; record = record->next)
      drop(record->owner);
    for (Block* block = current->blocks_; block != nullptr;) std::free(std::exchange(block, block->next));
    current->~Document();
    std::free(const_cast<Document*>(current));
  }
}

}  // namespace brenvik::plist
