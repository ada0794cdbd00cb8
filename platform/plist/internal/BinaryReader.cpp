// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/BinaryReader.h"

#include <algorithm>
#include <bit>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <span>
#include <vector>

#include "platform/plist/internal/BinaryFormat.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/Text.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik::plist {
namespace {

class Reader {
 public:
  // A whole document.
  explicit Reader(std::string_view bytes) : Reader(bytes, bytes.size()) {}
  // Objects that begin at these offsets; the top is the first, and references count from `first`.
  Reader(std::string_view bytes, std::span<const std::uint32_t> offsets, std::size_t first,
         std::size_t referenceWidth)
      : Reader(bytes, bytes.size() - offsets.front()) {
    end_ = begin_ + size_;
    offsets_ = offsets.data();
    objects_ = offsets.size();
    first_ = first;
    referenceWidth_ = referenceWidth;
  }
  // Of a whole document: finds its objects. False when it is malformed.
  bool readTrailer();
  // The top object's value.
  PropertyList read();

 private:
  static constexpr std::size_t kFirstBlock = std::size_t{64} << 10;

  Reader(std::string_view bytes, std::size_t objectBytes)
      : begin_(reinterpret_cast<const unsigned char*>(bytes.data())),
        size_(bytes.size()),
        document_(std::min(objectBytes + 64, kFirstBlock)),
        unspent_(objectBytes) {}

  // What is known of an object of the file.
  struct Slot {
    Node node;           // tag none: not looked at yet; pending: a container on the path from the top
    std::uint32_t done;  // of a finished container with children: its place in done_
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

  bool readObject(std::size_t object);
  bool readInteger(const unsigned char* at, unsigned power, Node& node);
  bool readReal(const unsigned char* at, unsigned power, Node& node);
  bool readDate(const unsigned char* at, unsigned power, Node& node);
  bool readUid(const unsigned char* at, std::size_t width, Slot& slot);
  bool readText(const ObjectHead& head, const unsigned char* at, Node& node);
  bool beginContainer(std::size_t object, const ObjectHead& head, const unsigned char* at);
  void endContainer();
  bool walk();
  bool step();
  bool addToFrame(Slot& slot);
  Measure measureOf(const Slot& slot) const noexcept {
    const bool isFull = slot.node.isContainer() && slot.node.size != 0;
    return isFull ? done_[slot.done] : leafMeasure(slot.node);
  }
  std::uint64_t offsetOf(std::size_t object) const noexcept {
    return offsets_ != nullptr ? offsets_[object] : loadBig(end_ + object * offsetWidth_, offsetWidth_);
  }
  std::size_t before(const unsigned char* at) const noexcept { return static_cast<std::size_t>(end_ - at); }
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

  const unsigned char* end_ = nullptr;      // of the objects; in a whole document the offsets begin here
  const std::uint32_t* offsets_ = nullptr;  // where they are not in the document
  std::size_t offsetWidth_ = 0;
  std::size_t referenceWidth_ = 0;
  std::size_t objects_ = 0;
  std::size_t top_ = 0;
  std::size_t first_ = 0;  // what references count from
  std::size_t unspent_;
  std::size_t references_ = 0;

  std::unique_ptr<Slot[], Free> slots_;
  std::vector<Frame> frames_;
  std::vector<Measure> done_;
};

bool Reader::readTrailer() {
  if (size_ < kBinaryMagic.size() + kTrailerSize ||
      std::memcmp(begin_, kBinaryMagic.data(), kBinaryMagic.size()) != 0) {
    return false;
  }
  const std::size_t end = size_ - kTrailerSize;
  const auto [offsetWidth, referenceWidth, objects, top, table] = loadTrailer(begin_ + end);
  if (offsetWidth < 1 || offsetWidth > 8 || referenceWidth < 1 || referenceWidth > 8) return false;
  if (table <= kBinaryMagic.size() || table > end) return false;
  // Each object has at least one byte of its own, and an offset.
  if (objects == 0 || top >= objects || objects > table - kBinaryMagic.size()) return false;
  if (objects > (end - table) / offsetWidth || objects > UINT32_MAX) return false;
  end_ = begin_ + table;
  offsetWidth_ = offsetWidth;
  referenceWidth_ = referenceWidth;
  objects_ = static_cast<std::size_t>(objects);
  top_ = static_cast<std::size_t>(top);
  unspent_ = static_cast<std::size_t>(table) - kBinaryMagic.size();
  return true;
}

bool Reader::readInteger(const unsigned char* at, unsigned power, Node& node) {
  const std::size_t width = std::size_t{1} << power;
  if (power > 4 || before(at) < width || !spend(1 + width)) return false;
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

bool Reader::readReal(const unsigned char* at, unsigned power, Node& node) {
  const std::size_t width = std::size_t{1} << power;
  if ((power != 2 && power != 3) || before(at) < width || !spend(1 + width)) return false;
  const std::uint64_t bits = loadBig(at, width);
  node.tag = Tag::real;
  node.real = power == 3 ? std::bit_cast<double>(bits)
                         : static_cast<double>(std::bit_cast<float>(static_cast<std::uint32_t>(bits)));
  return true;
}

bool Reader::readDate(const unsigned char* at, unsigned power, Node& node) {
  if (power != 3 || before(at) < 8 || !spend(9)) return false;
  node.tag = Tag::date;
  node.real = std::bit_cast<double>(loadBig(at, 8));
  return true;
}

bool Reader::readUid(const unsigned char* at, std::size_t width, Slot& slot) {
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
  slot.node = finishDictionary(pair, 1);
  slot.done = static_cast<std::uint32_t>(done_.size());
  Measure measure{tagExtent(Tag::dictionary), 1};
  measure.addChild(leafMeasure(pair[0]));
  measure.addChild(leafMeasure(pair[1]));
  done_.push_back(measure);
  return true;
}

bool Reader::readText(const ObjectHead& head, const unsigned char* at, Node& node) {
  const bool isUtf16 = head.kind == kUtf16Object;
  const std::size_t count = head.count;
  const std::size_t width = isUtf16 ? 2 : 1;
  if (count > before(at) / width || !spend(head.size + count * width)) return false;
  node.tag = head.kind == kDataObject ? Tag::data : Tag::string;
  node.text = "";
  if (count == 0) return true;
  std::size_t size = count;
  if (isUtf16) {
    char* const to = document_->allocateText(count * 3);
    char* const stop = utf8FromUtf16<ByteOrder::big>(at, count, to);
    document_->trim(stop == nullptr ? to : stop);
    if (stop == nullptr) return false;
    node.text = to;
    size = static_cast<std::size_t>(stop - to);
  } else {
    const char* const from = reinterpret_cast<const char*>(at);
    if (head.kind == kAsciiObject && !isAscii(from, count)) return false;
    node.text = document_->copyText(from, count);
  }
  if (size > UINT32_MAX) return false;
  node.size = static_cast<std::uint32_t>(size);
  return true;
}

bool Reader::beginContainer(std::size_t object, const ObjectHead& head, const unsigned char* at) {
  Node& node = slots_[object].node;
  const bool isDictionary = head.kind == kDictionaryObject;
  const std::size_t count = head.count;
  if (count > before(at) / referenceWidth_ / (isDictionary ? 2 : 1)) return false;
  const std::size_t references = head.references();
  if (!spend(head.size + references * referenceWidth_)) return false;
  if (count == 0) {
    node.tag = isDictionary ? Tag::dictionary : Tag::array;
    node.children = nullptr;
    return true;
  }
  // Every reference is at least eight bytes of the document as XML.
  references_ += references;
  if (frames_.size() == kMaxPropertyListDepth || references_ > kLargestXmlForm / 8) return false;
  const std::size_t room = isDictionary ? dictionaryBytes(count) : count * sizeof(Node);
  auto* const children = static_cast<Node*>(document_->allocate(room));
  node.tag = Tag::pending;
  const Measure own{tagExtent(isDictionary ? Tag::dictionary : Tag::array), 1};
  frames_.push_back({object, at, children, references, 0, own, isDictionary});
  return true;
}

void Reader::endContainer() {
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
}

// Reads a scalar into its slot, or begins a container.
bool Reader::readObject(std::size_t object) {
  Node& node = slots_[object].node;
  const std::uint64_t offset = offsetOf(object);
  if (offset < kBinaryMagic.size() || offset >= static_cast<std::uint64_t>(end_ - begin_)) return false;
  ObjectHead head;
  if (!readHead(begin_ + offset, end_, &head)) return false;
  const unsigned char* const at = begin_ + offset + head.size;
  switch (head.kind) {
    case kSimpleObject:
      if (head.low != 8 && head.low != 9) return false;
      node.tag = Tag::boolean;
      node.integer = head.low == 9 ? 1 : 0;
      return spend(1);
    case kIntegerObject:
      return readInteger(at, head.low, node);
    case kRealObject:
      return readReal(at, head.low, node);
    case kDateObject:
      return readDate(at, head.low, node);
    case kUidObject:
      return readUid(at, std::size_t{head.low} + 1, slots_[object]);
    case kDataObject:
    case kAsciiObject:
    case kUtf16Object:
      return readText(head, at, node);
    case kArrayObject:
    case kDictionaryObject:
      return beginContainer(object, head, at);
    default:
      return false;
  }
}

// Looks at one more child of the container that was begun last. A child that is a container itself, and was
// not looked at before, is begun, and looked at again when it is finished.
bool Reader::step() {
  const Frame& frame = frames_.back();
  const std::uint64_t object =
      loadBig(frame.references + frame.next * referenceWidth_, referenceWidth_) - first_;
  if (object >= objects_) return false;
  Slot& slot = slots_[object];
  if (slot.node.tag == Tag::pending) return false;  // a container within itself
  if (slot.node.tag == Tag::none) {
    const std::size_t depth = frames_.size();
    if (!readObject(object)) return false;
    if (frames_.size() != depth) return true;
  }
  return addToFrame(slot);
}

bool Reader::addToFrame(Slot& slot) {
  Frame& frame = frames_.back();
  Node& node = slot.node;
  frame.measure.addChild(measureOf(slot));
  if (frames_.size() - 1 + frame.measure.height > kMaxPropertyListDepth) return false;
  const std::size_t entries = frame.count / 2;
  if (!frame.isDictionary) {
    frame.children[frame.next] = node;
  } else if (frame.next >= entries) {
    frame.children[2 * (frame.next - entries) + 1] = node;
  } else {
    if (node.tag != Tag::string) return false;
    if (node.hash[0] == 0 && node.hash[1] == 0 && node.hash[2] == 0) setKeyHash(node);
    frame.children[2 * frame.next] = node;
  }
  ++frame.next;
  return true;
}

// Depth first from the top, looking at each object once. The path is never longer than the levels allowed.
bool Reader::walk() {
  if (!readObject(top_)) return false;
  while (!frames_.empty()) {
    if (frames_.back().next == frames_.back().count) {
      endContainer();
    } else if (!step()) {
      return false;
    }
  }
  return true;
}

PropertyList Reader::read() {
  // Zeroed memory is a slot not looked at, and pages of objects that nothing refers to stay untouched.
  static_assert(static_cast<int>(Tag::none) == 0);
  slots_.reset(static_cast<Slot*>(std::calloc(objects_, sizeof(Slot))));
  if (slots_ == nullptr) throw std::bad_alloc();
  if (!walk()) return {};
  const Slot& top = slots_[top_];
  if (!fitsXmlLimit(measureOf(top).extent) && !xmlFormFits(top.node)) return {};
  const bool inArena = top.node.size != 0;
  return Access::make(top.node, inArena ? document_.handOver() : nullptr);
}

}  // namespace

PropertyList readBinary(std::string_view bytes) {
  Reader reader(bytes);
  return reader.readTrailer() ? reader.read() : PropertyList();
}

PropertyList readObjects(std::string_view bytes, std::span<const std::uint32_t> offsets, std::size_t first,
                         std::size_t referenceWidth) {
  return Reader(bytes, offsets, first, referenceWidth).read();
}

}  // namespace brenvik::plist
