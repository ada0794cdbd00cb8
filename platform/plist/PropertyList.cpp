// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/PropertyList.h"

#include <cmath>
#include <limits>
#include <unordered_map>

#include "platform/base/Utf8.h"
#include "platform/plist/internal/Document.h"

namespace brenvik {

using plist::Access;
using plist::Document;
using plist::DocumentHolder;
using plist::Node;
using plist::Tag;

namespace {

constexpr std::size_t kLargestCount = std::numeric_limits<std::uint32_t>::max();

// Texts up to this size are copied into a new container. Sharing them would cost a record of half the size,
// and would keep alive the document they came from: a dictionary that is changed again and again would drag
// all its predecessors along.
constexpr std::size_t kLargestCopied = 64;

Node scalar(Tag tag) noexcept {
  Node node;
  node.tag = tag;
  return node;
}

PropertyList textValue(Tag tag, const char* bytes, std::size_t size) {
  if (size > kLargestCount) return {};
  Node node = scalar(tag);
  node.size = static_cast<std::uint32_t>(size);
  node.text = "";
  if (size == 0) return Access::make(node, nullptr);
  DocumentHolder document(size);
  node.text = document->copyText(bytes, size);
  return Access::make(node, document.handOver());
}

bool isText(const Node& node) noexcept { return node.tag == Tag::string || node.tag == Tag::data; }

// Room that a child takes in its new parent's arena, its node aside.
std::size_t roomFor(const Node& node) noexcept {
  if (isText(node)) return node.size <= kLargestCopied ? node.size : sizeof(plist::Foreign);
  return node.isContainer() && node.size != 0 ? sizeof(plist::Foreign) : 0;
}

Node place(Document& document, const Node& child, const Document* owner) {
  const Node& node = plist::resolved(child);
  if (isText(node) && node.size <= kLargestCopied) {
    Node copy = node;
    copy.text = node.size == 0 ? "" : document.copyText(node.text, node.size);
    return copy;
  }
  if (!isText(node) && (!node.isContainer() || node.size == 0)) return node;
  return document.adopt(node, child.tag == Tag::foreign ? child.foreign->owner : owner);
}

// A handle to a child found in memory that `owner` keeps.
PropertyList share(const Node& child, const Document* owner) noexcept {
  const Document* const keeper = child.tag == Tag::foreign ? child.foreign->owner : owner;
  const Node& node = plist::resolved(child);
  if ((!isText(node) && !node.isContainer()) || node.size == 0) return Access::make(node, nullptr);
  if (keeper != nullptr) keeper->retain();
  return Access::make(node, keeper);
}

Node keyNode(std::string_view key) noexcept {
  Node node = scalar(Tag::string);
  node.text = key.empty() ? "" : key.data();  // never null: it is compared
  node.size = static_cast<std::uint32_t>(key.size());
  plist::setKeyHash(node);
  return node;
}

// Classes of containers found equal so far. Merging classes instead of remembering pairs keeps the number of
// comparisons linear: n shared things against m shared things could meet in n*m pairs.
class EqualClasses {
 public:
  // False when they were one class already.
  bool merge(const Node* one, const Node* other) {
    const Node* const first = find(one);
    const Node* const second = find(other);
    if (first == second) return false;
    parent_[first] = second;
    return true;
  }

 private:
  const Node* find(const Node* children) {
    const Node* root = children;
    for (auto up = parent_.find(root); up != parent_.end(); up = parent_.find(root)) root = up->second;
    while (children != root) children = std::exchange(parent_[children], root);
    return root;
  }
  std::unordered_map<const Node*, const Node*> parent_;
};

bool sameScalar(const Node& one, const Node& other) noexcept {
  switch (one.tag) {
    case Tag::string:
    case Tag::data:
      return one.size == other.size && std::memcmp(one.text, other.text, one.size) == 0;
    case Tag::real:
    case Tag::date:
      return one.real == other.real || (std::isnan(one.real) && std::isnan(other.real));
    default:
      return one.bits == other.bits;
  }
}

enum class Answer { equal, different, tooManySteps };

// Compares two values, a container at a time. With `classes` in time linear in the nodes stored. Without,
// faster for a tree, but never more than `allowed` children compared.
class Comparison {
 public:
  Comparison(EqualClasses* classes, std::size_t allowed) : classes_(classes), allowed_(allowed) {}

  Answer compare(const Node& left, const Node& right) {
    if (!enter(left, right)) return Answer::different;
    while (!open_.empty()) {
      const auto [one, other] = open_.back();
      open_.pop_back();
      if (classes_ == nullptr) {
        if (allowed_ < one->size) return Answer::tooManySteps;
        allowed_ -= one->size;
      }
      if (!(one->tag == Tag::array ? enterElements(*one, *other) : enterEntries(*one, *other))) {
        return Answer::different;
      }
    }
    return Answer::equal;
  }

 private:
  struct Pair {
    const Node* left;
    const Node* right;
  };

  // Compares all but the children of containers, which it puts off.
  bool enter(const Node& left, const Node& right) {
    const Node& one = plist::resolved(left);
    const Node& other = plist::resolved(right);
    if (one.tag != other.tag) return false;
    if (!one.isContainer()) return sameScalar(one, other);
    if (one.size != other.size) return false;
    if (one.children == other.children) return true;
    if (classes_ == nullptr || classes_->merge(one.children, other.children)) open_.push_back({&one, &other});
    return true;
  }

  bool enterElements(const Node& one, const Node& other) {
    for (std::size_t i = 0; i < one.size; ++i) {
      if (!enter(one.children[i], other.children[i])) return false;
    }
    return true;
  }

  bool enterEntries(const Node& one, const Node& other) {
    for (std::size_t i = 0; i < one.size; ++i) {
      const Node& key = one.children[2 * i];
      const Node* match = other.children + 2 * i;
      if (!plist::sameKey(key, *match)) match = plist::findKey(other, key);
      if (match == nullptr || !enter(one.children[2 * i + 1], match[1])) return false;
    }
    return true;
  }

  EqualClasses* const classes_;
  std::size_t allowed_;
  std::vector<Pair> open_;
};

}  // namespace

PropertyList::PropertyList(const PropertyList& other) noexcept : node_(other.node_), owner_(other.owner_) {
  if (owner_ != nullptr) owner_->retain();
}

PropertyList& PropertyList::operator=(const PropertyList& other) noexcept {
  PropertyList copy(other);
  std::swap(node_, copy.node_);
  std::swap(owner_, copy.owner_);
  return *this;
}

PropertyList& PropertyList::operator=(PropertyList&& other) noexcept {
  PropertyList moved(std::move(other));
  std::swap(node_, moved.node_);
  std::swap(owner_, moved.owner_);
  return *this;
}

void PropertyList::letGo() noexcept { Document::release(owner_); }

PropertyList PropertyList::boolean(bool value) noexcept {
  Node node = scalar(Tag::boolean);
  node.integer = value ? 1 : 0;
  return Access::make(node, nullptr);
}

PropertyList PropertyList::integer(std::int64_t value) noexcept {
  Node node = scalar(Tag::integer);
  node.integer = value;
  return Access::make(node, nullptr);
}

PropertyList PropertyList::unsignedInteger(std::uint64_t value) noexcept {
  Node node = scalar(value > std::uint64_t{INT64_MAX} ? Tag::unsignedInteger : Tag::integer);
  node.unsignedInteger = value;
  return Access::make(node, nullptr);
}

PropertyList PropertyList::real(double value) noexcept {
  Node node = scalar(Tag::real);
  node.real = value;
  return Access::make(node, nullptr);
}

PropertyList PropertyList::date(double secondsSince2001) noexcept {
  Node node = scalar(Tag::date);
  node.real = secondsSince2001;
  return Access::make(node, nullptr);
}

PropertyList PropertyList::string(std::string_view utf8) {
  if (!isValidUtf8(utf8)) return {};
  return textValue(Tag::string, utf8.data(), utf8.size());
}

PropertyList PropertyList::data(std::span<const std::byte> bytes) {
  return textValue(Tag::data, reinterpret_cast<const char*>(bytes.data()), bytes.size());
}

PropertyList PropertyList::array(const std::vector<PropertyList>& elements) {
  std::size_t count = 0;
  std::size_t room = 0;
  for (const PropertyList& element : elements) {
    if (!element) continue;
    ++count;
    room += sizeof(Node) + roomFor(element.node_);
  }
  if (count > kLargestCount) return {};
  Node node = scalar(Tag::array);
  node.size = static_cast<std::uint32_t>(count);
  if (count == 0) return Access::make(node, nullptr);
  DocumentHolder document(room);
  auto* next = static_cast<Node*>(document->allocate(count * sizeof(Node)));
  node.children = next;
  for (const PropertyList& element : elements) {
    if (element) *next++ = place(*document, element.node_, element.owner_);
  }
  return Access::make(node, document.handOver());
}

PropertyList PropertyList::dictionary(const std::vector<std::pair<std::string, PropertyList>>& entries) {
  std::size_t count = 0;
  std::size_t room = 0;
  for (const auto& [key, value] : entries) {
    if (!value) continue;
    if (key.size() > kLargestCount || !isValidUtf8(key)) return {};
    ++count;
    room += key.size() + roomFor(value.node_);
  }
  if (count > kLargestCount / 2) return {};
  if (count == 0) return Access::make(scalar(Tag::dictionary), nullptr);
  const std::size_t table = plist::dictionaryBytes(count);
  DocumentHolder document(table + room + sizeof(Node));
  auto* const pairs = static_cast<Node*>(document->allocate(table));
  Node* next = pairs;
  for (const auto& [key, value] : entries) {
    if (!value) continue;
    *next = keyNode(key);
    next->text = document->copyText(key.data(), key.size());
    next[1] = place(*document, value.node_, value.owner_);
    next += 2;
  }
  return Access::make(plist::finishDictionary(pairs, count), document.handOver());
}

PropertyList PropertyList::withEntry(std::string_view key, const PropertyList& value) const {
  if (node_.tag != Tag::dictionary || key.size() > kLargestCount || !isValidUtf8(key)) return {};
  const Node wanted = keyNode(key);
  const Node* const old = node_.size == 0 ? nullptr : plist::findKey(node_, wanted);
  if (!value && old == nullptr) return *this;
  const std::size_t count = node_.size + std::size_t{old == nullptr} - std::size_t{!value};
  if (count > kLargestCount / 2) return {};
  if (count == 0) return Access::make(scalar(Tag::dictionary), nullptr);
  std::size_t room = key.size() + roomFor(value.node_);
  const Node* const end = node_.children + node_.childCount();
  for (const Node* pair = node_.children; pair != end; pair += 2) {
    room += pair->size + roomFor(plist::resolved(pair[1]));
  }
  const std::size_t table = plist::dictionaryBytes(count);
  DocumentHolder document(table + room + sizeof(Node));
  auto* const pairs = static_cast<Node*>(document->allocate(table));
  Node* next = pairs;
  auto add = [&](const Node& entryKey, const Node& entryValue, const Document* owner) {
    *next = entryKey;
    next->text = document->copyText(entryKey.text, entryKey.size);
    next[1] = place(*document, entryValue, owner);
    next += 2;
  };
  for (const Node* pair = node_.children; pair != end; pair += 2) {
    if (pair != old) {
      add(pair[0], pair[1], owner_);
    } else if (value) {
      add(pair[0], value.node_, value.owner_);
    }
  }
  if (old == nullptr) add(wanted, value.node_, value.owner_);
  return Access::make(plist::finishDictionary(pairs, count), document.handOver());
}

PropertyList::Type PropertyList::type() const noexcept {
  switch (node_.tag) {
    case Tag::boolean:
      return Type::boolean;
    case Tag::integer:
    case Tag::unsignedInteger:
      return Type::integer;
    case Tag::real:
      return Type::real;
    case Tag::date:
      return Type::date;
    case Tag::data:
      return Type::data;
    case Tag::array:
      return Type::array;
    case Tag::dictionary:
      return Type::dictionary;
    case Tag::string:
    case Tag::none:
    case Tag::foreign:
    case Tag::pending:
      break;
  }
  return Type::string;
}

std::optional<bool> PropertyList::asBoolean() const noexcept {
  if (node_.tag != Tag::boolean) return std::nullopt;
  return node_.integer != 0;
}

std::optional<std::int64_t> PropertyList::asInteger() const noexcept {
  if (node_.tag != Tag::integer) return std::nullopt;
  return node_.integer;
}

std::optional<std::uint64_t> PropertyList::asUnsignedInteger() const noexcept {
  if (node_.tag != Tag::unsignedInteger && (node_.tag != Tag::integer || node_.integer < 0))
    return std::nullopt;
  return node_.unsignedInteger;
}

std::optional<double> PropertyList::asReal() const noexcept {
  if (node_.tag != Tag::real) return std::nullopt;
  return node_.real;
}

std::optional<double> PropertyList::asDate() const noexcept {
  if (node_.tag != Tag::date) return std::nullopt;
  return node_.real;
}

std::optional<std::string_view> PropertyList::asString() const noexcept {
  if (node_.tag != Tag::string) return std::nullopt;
  return std::string_view(node_.text, node_.size);
}

std::optional<std::span<const std::byte>> PropertyList::asData() const noexcept {
  if (node_.tag != Tag::data) return std::nullopt;
  return std::span(reinterpret_cast<const std::byte*>(node_.text), node_.size);
}

PropertyList PropertyList::at(std::size_t index) const noexcept {
  if (index >= size()) return {};
  return share(node_.children[node_.tag == Tag::array ? index : 2 * index + 1], owner_);
}

std::string_view PropertyList::keyAt(std::size_t index) const noexcept {
  if (node_.tag != Tag::dictionary || index >= node_.size) return {};
  const Node& key = node_.children[2 * index];
  return {key.text, key.size};
}

PropertyList PropertyList::find(std::string_view key) const noexcept {
  if (node_.tag != Tag::dictionary || node_.size == 0 || key.size() > kLargestCount) return {};
  const Node* const found = plist::findKey(node_, keyNode(key));
  return found == nullptr ? PropertyList() : share(found[1], owner_);
}

bool PropertyList::operator==(const PropertyList& other) const {
  // Nearly every comparison ends here, without the cost of keeping classes.
  constexpr std::size_t kStepsWithoutMemory = 1 << 16;
  Answer answer = Comparison(nullptr, kStepsWithoutMemory).compare(node_, other.node_);
  if (answer == Answer::tooManySteps) {
    EqualClasses classes;
    answer = Comparison(&classes, 0).compare(node_, other.node_);
  }
  return answer == Answer::equal;
}

}  // namespace brenvik
