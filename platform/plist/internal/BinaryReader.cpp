// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/BinaryReader.h"

#include <algorithm>
#include <bit>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <vector>

#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/Text.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik::plist {
namespace {

std::uint64_t loadBig(const unsigned char* bytes, std::size_t width) noexcept {
  switch (width) {
    case 1:
      return bytes[0];
    case 2:
      return std::uint64_t{bytes[0]} << 8 | bytes[1];
    case 4: {
      std::uint32_t word;
      std::memcpy(&word, bytes, sizeof word);
      return __builtin_bswap32(word);
    }
    case 8: {
      std::uint64_t word;
      std::memcpy(&word, bytes, sizeof word);
      return __builtin_bswap64(word);
    }
    default: {
      std::uint64_t value = 0;
      for (std::size_t i = 0; i < width; ++i) value = value << 8 | bytes[i];
      return value;
    }
  }
}

class Reader {
 public:
  explicit Reader(std::string_view bytes)
      : begin_(reinterpret_cast<const unsigned char*>(bytes.data())),
        size_(bytes.size()),
        document_(std::min(bytes.size() + 64, kFirstBlock)) {}
  PropertyList read();

 private:
  static constexpr std::size_t kFirstBlock = std::size_t{64} << 10;

  // What is known of an object of the file.
  struct Slot {
    Node node;           // tag none: not looked at yet; pending: a container on the path from the top
    std::uint32_t done;  // of a finished container with children: its place in done_
  };
  struct Measure {
    XmlExtent extent;  // at least
    std::size_t height;
  };
  struct Frame {
    std::size_t object;
    const unsigned char* references;
    Node* children;
    std::size_t count;  // references: twice the entries of a dictionary
    std::size_t next;
    Measure measure;
    bool isDictionary;
  };
  struct Free {
    void operator()(void* memory) const noexcept { std::free(memory); }
  };

  bool readTrailer();
  bool readObject(std::size_t object);
  bool readInteger(const unsigned char* at, std::size_t width, Node& node);
  bool readText(unsigned char marker, const unsigned char* at, std::size_t count, Node& node);
  bool beginContainer(std::size_t object, bool isDictionary, const unsigned char* at, std::size_t count);
  bool endContainer();
  bool walk();
  std::size_t before(const unsigned char* at) const noexcept { return static_cast<std::size_t>(table_ - at); }
  // Counts an object's bytes. Objects do not overlap, so that all of them together are no more than there are
  // bytes; a file whose objects do could make us copy one range again and again.
  bool spend(std::size_t bytes) noexcept {
    if (bytes > unspent_) return false;
    unspent_ -= bytes;
    return true;
  }

  const unsigned char* begin_;
  std::size_t size_;
  DocumentHolder document_;

  const unsigned char* table_ = nullptr;  // of offsets; objects end before it
  std::size_t offsetWidth_ = 0;
  std::size_t referenceWidth_ = 0;
  std::size_t objects_ = 0;
  std::size_t top_ = 0;
  std::size_t unspent_ = 0;
  std::size_t references_ = 0;

  std::unique_ptr<Slot[], Free> slots_;
  std::vector<Frame> frames_;
  std::vector<Measure> done_;
};

bool Reader::readTrailer() {
  if (size_ < kBinaryMagic.size() + kBinaryTrailer ||
      std::memcmp(begin_, kBinaryMagic.data(), kBinaryMagic.size()) != 0) {
    return false;
  }
  const unsigned char* const trailer = begin_ + size_ - kBinaryTrailer;
  offsetWidth_ = trailer[6];
  referenceWidth_ = trailer[7];
  const std::uint64_t objects = loadBig(trailer + 8, 8);
  const std::uint64_t top = loadBig(trailer + 16, 8);
  const std::uint64_t table = loadBig(trailer + 24, 8);
  if (offsetWidth_ < 1 || offsetWidth_ > 8 || referenceWidth_ < 1 || referenceWidth_ > 8) return false;
  const std::size_t end = size_ - kBinaryTrailer;
  if (table <= kBinaryMagic.size() || table > end) return false;
  // Each object has at least one byte of its own, and an offset.
  if (objects == 0 || top >= objects || objects > table - kBinaryMagic.size()) return false;
  if (objects > (end - table) / offsetWidth_ || objects > UINT32_MAX) return false;
  table_ = begin_ + table;
  objects_ = static_cast<std::size_t>(objects);
  top_ = static_cast<std::size_t>(top);
  unspent_ = static_cast<std::size_t>(table) - kBinaryMagic.size();
  return true;
}

bool Reader::readInteger(const unsigned char* at, std::size_t width, Node& node) {
  node.tag = Tag::integer;
  if (width <= 8) {
    node.unsignedInteger = loadBig(at, width);  // of eight bytes: with its sign
    return true;
  }
  const std::uint64_t high = loadBig(at, 8);
  node.unsignedInteger = loadBig(at + 8, 8);
  const bool topBit = node.integer < 0;
  if (high == 0) {
    if (topBit) node.tag = Tag::unsignedInteger;
    return true;
  }
  return high == UINT64_MAX && topBit;
}

bool Reader::readText(unsigned char marker, const unsigned char* at, std::size_t count, Node& node) {
  const std::size_t width = marker == 0x60 ? 2 : 1;
  if (count > before(at) / width || !spend(count * width)) return false;
  node.tag = marker == 0x40 ? Tag::data : Tag::string;
  node.text = "";
  if (count == 0) return true;
  std::size_t size = count;
  if (marker == 0x60) {
    char* const to = document_->allocateText(count * 3);
    char* const stop = utf8FromUtf16<ByteOrder::big>(at, count, to);
    document_->trim(stop == nullptr ? to : stop);
    if (stop == nullptr) return false;
    node.text = to;
    size = static_cast<std::size_t>(stop - to);
  } else {
    const char* const from = reinterpret_cast<const char*>(at);
    if (marker == 0x50 && !isAscii(from, count)) return false;
    node.text = document_->copyText(from, count);
  }
  if (size > UINT32_MAX) return false;
  node.size = static_cast<std::uint32_t>(size);
  return true;
}

bool Reader::beginContainer(std::size_t object, bool isDictionary, const unsigned char* at,
                            std::size_t count) {
  Node& node = slots_[object].node;
  const std::size_t perEntry = isDictionary ? 2 : 1;
  if (count > before(at) / referenceWidth_ / perEntry) return false;
  const std::size_t references = count * perEntry;
  if (!spend(references * referenceWidth_)) return false;
  if (count == 0) {
    node.tag = isDictionary ? Tag::dictionary : Tag::array;
    node.children = nullptr;
    return true;
  }
  // Every reference is at least eight bytes of the document as XML.
  references_ += references;
  if (frames_.size() == kDeepestPropertyList || references_ > kLargestXmlForm / 8) return false;
  const std::size_t room = isDictionary ? dictionaryBytes(count) : count * sizeof(Node);
  auto* const children = static_cast<Node*>(document_->allocate(room));
  node.tag = Tag::pending;
  const Measure own{tagExtent(isDictionary ? Tag::dictionary : Tag::array), 1};
  frames_.push_back({object, at, children, references, 0, own, isDictionary});
  return true;
}

bool Reader::endContainer() {
  const Frame& frame = frames_.back();
  Slot& slot = slots_[frame.object];
  if (frame.isDictionary) {
    slot.node = finishDictionary(frame.children, frame.count / 2);
  } else {
    slot.node.tag = Tag::array;
    slot.node.size = static_cast<std::uint32_t>(frame.count);
    slot.node.children = frame.children;
  }
  slot.done = static_cast<std::uint32_t>(done_.size());
  done_.push_back(frame.measure);
  frames_.pop_back();
  return true;
}

// Reads a scalar into its slot, or begins a container.
bool Reader::readObject(std::size_t object) {
  Node& node = slots_[object].node;
  const std::uint64_t offset = loadBig(table_ + object * offsetWidth_, offsetWidth_);
  if (offset < kBinaryMagic.size() || offset >= static_cast<std::uint64_t>(table_ - begin_)) return false;
  const unsigned char* at = begin_ + offset;
  const unsigned char marker = *at++;
  const unsigned char kind = marker & 0xF0;
  const unsigned low = marker & 0x0F;
  switch (kind) {
    case 0x00:
      if (marker != 0x08 && marker != 0x09) return false;
      node.tag = Tag::boolean;
      node.integer = marker == 0x09 ? 1 : 0;
      return spend(1);
    case 0x10: {
      const std::size_t width = std::size_t{1} << low;
      if (low > 4 || before(at) < width || !spend(1 + width)) return false;
      return readInteger(at, width, node);
    }
    case 0x20: {
      const std::size_t width = std::size_t{1} << low;
      if ((low != 2 && low != 3) || before(at) < width || !spend(1 + width)) return false;
      const std::uint64_t bits = loadBig(at, width);
      node.tag = Tag::real;
      node.real = low == 3 ? std::bit_cast<double>(bits)
                           : static_cast<double>(std::bit_cast<float>(static_cast<std::uint32_t>(bits)));
      return true;
    }
    case 0x30:
      if (low != 3 || before(at) < 8 || !spend(9)) return false;
      node.tag = Tag::date;
      node.real = std::bit_cast<double>(loadBig(at, 8));
      return true;
    case 0x80: {
      const std::size_t width = low + 1;
      if (width > 8 || before(at) < width || !spend(1 + width)) return false;
      auto* const pair = static_cast<Node*>(document_->allocate(dictionaryBytes(1)));
      pair[0] = Node();
      pair[0].tag = Tag::string;
      pair[0].text = kUidKey;
      pair[0].size = sizeof kUidKey - 1;
      setKeyHash(pair[0]);
      pair[1] = Node();
      pair[1].unsignedInteger = loadBig(at, width);
      pair[1].tag = pair[1].integer < 0 ? Tag::unsignedInteger : Tag::integer;
      node = finishDictionary(pair, 1);
      slots_[object].done = static_cast<std::uint32_t>(done_.size());
      Measure measure{tagExtent(Tag::dictionary), 1};
      measure.extent.addChild(largestExtent(pair[0]));
      measure.extent.addChild(largestExtent(pair[1]));
      done_.push_back(measure);
      return true;
    }
    case 0x40:
    case 0x50:
    case 0x60:
    case 0xA0:
    case 0xD0: {
      std::uint64_t count = low;
      std::size_t spent = 1;
      if (low == 15) {
        if (before(at) < 1 || (*at & 0xFC) != 0x10) return false;
        const std::size_t width = std::size_t{1} << (*at++ & 3);
        if (before(at) < width) return false;
        count = loadBig(at, width);
        at += width;
        spent += 1 + width;
      }
      if (count > size_ || !spend(spent)) return false;
      const auto few = static_cast<std::size_t>(count);
      if (kind < 0xA0) return readText(kind, at, few, node);
      return beginContainer(object, kind == 0xD0, at, few);
    }
    default:
      return false;
  }
}

// Depth first from the top, looking at each object once. The path is never longer than the levels allowed.
bool Reader::walk() {
  if (!readObject(top_)) return false;
  while (!frames_.empty()) {
    Frame& frame = frames_.back();
    if (frame.next == frame.count) {
      if (!endContainer()) return false;
      continue;
    }
    const std::uint64_t object = loadBig(frame.references + frame.next * referenceWidth_, referenceWidth_);
    if (object >= objects_) return false;
    Slot& slot = slots_[object];
    Node& node = slot.node;
    if (node.tag == Tag::none) {
      const std::size_t depth = frames_.size();
      if (!readObject(object)) return false;
      if (frames_.size() != depth) continue;  // a container: looked at again when it is finished
    } else if (node.tag == Tag::pending) {
      return false;  // a container within itself
    }
    // The frame may have moved only in the case left above.
    const bool isFull = node.isContainer() && node.size != 0;
    const Measure child =
        isFull ? done_[slot.done] : Measure{largestExtent(node), std::size_t{node.isContainer()}};
    frame.measure.extent.addChild(child.extent);
    frame.measure.height = std::max(frame.measure.height, child.height + 1);
    if (frames_.size() - 1 + frame.measure.height > kDeepestPropertyList) return false;
    if (!frame.isDictionary) {
      frame.children[frame.next] = node;
    } else {
      const std::size_t entries = frame.count / 2;
      if (frame.next < entries) {
        if (node.tag != Tag::string) return false;
        if (node.hash[0] == 0 && node.hash[1] == 0 && node.hash[2] == 0) setKeyHash(node);
        frame.children[2 * frame.next] = node;
      } else {
        frame.children[2 * (frame.next - entries) + 1] = node;
      }
    }
    ++frame.next;
  }
  return true;
}

PropertyList Reader::read() {
  if (!readTrailer()) return {};
  // Zeroed memory is a slot not looked at, and pages of objects that nothing refers to stay untouched.
  static_assert(static_cast<int>(Tag::none) == 0);
  slots_.reset(static_cast<Slot*>(std::calloc(objects_, sizeof(Slot))));
  if (slots_ == nullptr) throw std::bad_alloc();
  if (!walk()) return {};
  const Slot& top = slots_[top_];
  const bool isFull = top.node.isContainer() && top.node.size != 0;
  const XmlExtent most = isFull ? done_[top.done].extent : largestExtent(top.node);
  if (!fitsXmlLimit(most) && !xmlFormFits(top.node)) return {};
  const bool inArena = top.node.size != 0;
  return Access::make(top.node, inArena ? document_.handOver() : nullptr);
}

}  // namespace

PropertyList readBinary(std::string_view bytes) { return Reader(bytes).read(); }

}  // namespace brenvik::plist
