// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist/Node.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik::plist {

// A document in the binary format. Equal scalars are written once, and so are shared containers. Nothing when
// the value is beyond a limit. Throws std::bad_alloc.
std::optional<std::string> writeBinary(const Node& root);

// Writes the objects of one value at a time, to be part of a document. May throw std::bad_alloc, and is good
// for another value then.
class ObjectWriter {
 public:
  // Takes in the value and all that it holds, which outlive append(). False when it is beyond a limit.
  bool select(const Node& root);

  // Of the selected value. The measure is never too small.
  std::size_t objects() const noexcept { return objects_.size(); }
  Measure measure() const noexcept;
  // Bytes that append() writes at most.
  std::size_t room(std::size_t referenceWidth) const noexcept;
  // Appends the objects to `out`, the value first, and where each of them begins there to `offsets`.
  // References count from `first`, the number that the value has in its document, and have `referenceWidth`
  // bytes.
  void append(std::string& out, std::vector<std::uint32_t>& offsets, std::size_t first,
              std::size_t referenceWidth) const;

 private:
  struct Object {
    Node node;
    std::uint32_t references = 0;  // of a container: where they begin
    std::uint32_t done = 0;        // of a container, when finished: its place among the measures
  };

  // Objects known so far, by what they say: open addressing, at least twice as many places as objects.
  class ObjectTable {
   public:
    static constexpr std::uint32_t kNew = UINT32_MAX;
    // The number of the equal object, or kNew: the caller then adds this one behind the others.
    std::uint32_t findOrAdd(const Node& node, std::uint32_t hash, const std::vector<Object>& objects);
    void clear() noexcept { places_.clear(); }

   private:
    struct Place {
      std::uint32_t hash;
      std::uint32_t object;
    };
    void enlarge();

    std::vector<Place> places_;
  };

  struct Frame {
    const Node* children;
    std::size_t count;
    std::size_t next;
    std::uint32_t object;
    Measure measure;
  };

  std::uint32_t add(const Node& node, std::uint32_t hash);
  bool enter(const Node& container);
  bool step();
  void leave();
  char* put(char* to, const Object& object, std::size_t first, std::size_t referenceWidth) const;

  ObjectTable table_;
  std::vector<Object> objects_;
  std::vector<std::uint32_t> references_;
  std::vector<Measure> done_;
  std::vector<Frame> frames_;
  std::size_t textRoom_ = 0;  // at least what texts take
};

}  // namespace brenvik::plist
