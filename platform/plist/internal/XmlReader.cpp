// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlReader.h"

#include <algorithm>
#include <charconv>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Base64.h"
#include "platform/plist/internal/Dates.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/XmlEncoding.h"
#include "platform/plist/internal/XmlMarkup.h"
#include "platform/plist/internal/XmlSize.h"
#include "platform/plist/internal/XmlText.h"

namespace brenvik::plist {
namespace {

std::string_view trimmed(std::string_view text) noexcept {
  while (!text.empty() && isXmlSpace(text.front())) text.remove_prefix(1);
  while (!text.empty() && isXmlSpace(text.back())) text.remove_suffix(1);
  return text;
}

bool readInteger(std::string_view text, Node& node) noexcept {
  text = trimmed(text);
  bool negative = false;
  int base = 10;
  if (text.starts_with("0x") || text.starts_with("0X")) {
    base = 16;
    text.remove_prefix(2);
  } else if (text.starts_with('-') || text.starts_with('+')) {
    negative = text.front() == '-';
    text.remove_prefix(1);
  }
  std::uint64_t magnitude = 0;
  const auto [stop, error] = std::from_chars(text.data(), text.data() + text.size(), magnitude, base);
  if (error != std::errc() || stop != text.data() + text.size()) return false;
  constexpr std::uint64_t kLowest = std::uint64_t{1} << 63;
  if (negative && magnitude > kLowest) return false;
  node.unsignedInteger = negative ? 0 - magnitude : magnitude;
  node.tag = !negative && magnitude >= kLowest ? Tag::unsignedInteger : Tag::integer;
  return true;
}

bool readReal(std::string_view text, Node& node) noexcept {
  text = trimmed(text);
  if (text.size() > 1 && text[0] == '+' && text[1] != '-') text.remove_prefix(1);
  double number = 0;
  const auto [stop, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || stop != text.data() + text.size()) return false;
  // from_chars() takes "nan(...)", which no property list has.
  if (!text.empty() && text.back() == ')') return false;
  node.tag = Tag::real;
  node.real = number;
  return true;
}

enum class Element : std::uint8_t {
  array,
  data,
  date,
  dictionary,
  no,
  integer,
  key,
  real,
  string,
  yes,
  unknown
};

constexpr XmlTag kTags[] = {{"array", "</array>"}, {"data", "</data>"},   {"date", "</date>"},
                            {"dict", "</dict>"},   {"false", "</false>"}, {"integer", "</integer>"},
                            {"key", "</key>"},     {"real", "</real>"},   {"string", "</string>"},
                            {"true", "</true>"}};
constexpr const XmlTag& tagOf(Element element) noexcept { return kTags[static_cast<std::size_t>(element)]; }

// Reads a name behind "<"; the byte behind it is for tagEnd() to judge.
Element elementName(XmlMarkup& in) noexcept {
  // Something must follow: the end of the root at least.
  if (in.left() < 8) return Element::unknown;
  const char* const at = in.at();
  Element candidate = Element::unknown;
  switch (*at) {
    case 'a':
      candidate = Element::array;
      break;
    case 'd':
      candidate = at[1] == 'i' ? Element::dictionary : at[3] == 'a' ? Element::data : Element::date;
      break;
    case 'f':
      candidate = Element::no;
      break;
    case 'i':
      candidate = Element::integer;
      break;
    case 'k':
      candidate = Element::key;
      break;
    case 'r':
      candidate = Element::real;
      break;
    case 's':
      candidate = Element::string;
      break;
    case 't':
      candidate = Element::yes;
      break;
    default:
      return Element::unknown;
  }
  return in.take(tagOf(candidate).name) ? candidate : Element::unknown;
}

class Reader {
 public:
  // The bytes are UTF-8 of XML's characters; `encoding` is what the document came in.
  Reader(std::string_view bytes, XmlEncoding encoding)
      : size_(bytes.size()),
        encoding_(encoding),
        in_(bytes),
        document_(std::min(bytes.size() + 64, kFirstBlock)) {}
  PropertyList read();

 private:
  static constexpr std::size_t kFirstBlock = std::size_t{64} << 10;
  using TagEnd = XmlMarkup::TagEnd;

  bool content();
  bool element();
  bool endElement();
  bool isKeyNext() const noexcept;
  bool beginContainer(bool isDictionary);
  bool endContainer();
  bool scalar(Element element);
  void textNode(std::string_view text, Node& node);
  bool dataNode(std::string_view text, Node& node);
  bool fits(const Node& root) const;

  const std::size_t size_;
  const XmlEncoding encoding_;
  XmlMarkup in_;
  XmlText text_{in_};
  DocumentHolder document_;

  struct Frame {
    std::size_t base;  // of its children among nodes_
    bool isDictionary;
  };
  std::vector<Frame> frames_;
  std::vector<Node> nodes_;  // children of what is open, keys included
  std::size_t nodeCount_ = 0;
  std::size_t deepest_ = 0;
};

void Reader::textNode(std::string_view text, Node& node) {
  node.tag = Tag::string;
  node.size = static_cast<std::uint32_t>(text.size());
  node.text = text.empty() ? "" : document_->copyText(text.data(), text.size());
}

bool Reader::dataNode(std::string_view text, Node& node) {
  node.tag = Tag::data;
  node.text = "";
  char* const to = document_->allocateText(base64DecodedRoom(text.size()));
  char* const stop = decodeBase64(text, to);
  document_->trim(stop == nullptr ? to : stop);
  if (stop == nullptr) return false;
  node.size = static_cast<std::uint32_t>(stop - to);
  if (node.size != 0) node.text = to;
  return true;
}

bool Reader::scalar(Element element) {
  const TagEnd end = in_.tagEnd();
  if (end == TagEnd::malformed) return false;
  Node& node = nodes_.emplace_back();
  if (element == Element::yes || element == Element::no) {
    node.tag = Tag::boolean;
    node.integer = element == Element::yes ? 1 : 0;
    return end == TagEnd::empty || in_.endTag(tagOf(element));
  }
  std::string_view value;
  if (end == TagEnd::open && !text_.read(tagOf(element), &value)) return false;
  switch (element) {
    case Element::key:
      textNode(value, node);
      setKeyHash(node);
      return true;
    case Element::string:
      textNode(value, node);
      return true;
    case Element::integer:
      return readInteger(value, node);
    case Element::real:
      return readReal(value, node);
    case Element::date: {
      const auto date = parseDate(value);
      node.tag = Tag::date;
      node.real = date.value_or(0);
      return date.has_value();
    }
    case Element::data:
      return dataNode(value, node);
    case Element::array:
    case Element::dictionary:
    case Element::no:
    case Element::yes:
    case Element::unknown:
      break;
  }
  return false;
}

bool Reader::beginContainer(bool isDictionary) {
  const TagEnd end = in_.tagEnd();
  if (end == TagEnd::malformed || frames_.size() == kMaxPropertyListDepth) return false;
  frames_.push_back({nodes_.size(), isDictionary});
  deepest_ = std::max(deepest_, frames_.size());
  return end == TagEnd::open || endContainer();
}

bool Reader::endContainer() {
  const auto [base, isDictionary] = frames_.back();
  frames_.pop_back();
  const std::size_t count = nodes_.size() - base;
  nodeCount_ += count;
  if (isDictionary && count % 2 != 0) return false;
  Node node;
  node.tag = isDictionary ? Tag::dictionary : Tag::array;
  node.children = nullptr;
  if (count != 0) {
    const std::size_t room = isDictionary ? dictionaryBytes(count / 2) : count * sizeof(Node);
    auto* const children = static_cast<Node*>(document_->allocate(room));
    std::memcpy(children, nodes_.data() + base, count * sizeof(Node));
    if (isDictionary) {
      node = finishDictionary(children, count / 2);
    } else {
      node.size = static_cast<std::uint32_t>(count);
      node.children = children;
    }
    nodes_.resize(base);
  }
  nodes_.push_back(node);
  return true;
}

bool Reader::isKeyNext() const noexcept {
  return !frames_.empty() && frames_.back().isDictionary && (nodes_.size() - frames_.back().base) % 2 == 0;
}

// An element that holds no elements, or the start of one that does.
bool Reader::element() {
  if (!in_.take('<')) return false;
  const Element element = elementName(in_);
  if (element == Element::unknown || isKeyNext() != (element == Element::key)) return false;
  const bool isDictionary = element == Element::dictionary;
  return isDictionary || element == Element::array ? beginContainer(isDictionary) : scalar(element);
}

bool Reader::endElement() {
  if (frames_.empty()) return false;
  const Element open = frames_.back().isDictionary ? Element::dictionary : Element::array;
  return in_.endTag(tagOf(open)) && endContainer();
}

// The one value of the document, which becomes nodes_[0].
bool Reader::content() {
  do {
    if (!in_.misc() || !(in_.startsEndTag() ? endElement() : element())) return false;
  } while (!frames_.empty());
  return true;
}

// The form that we would write may be larger than the one we read: it is indented.
bool Reader::fits(const Node& root) const {
  const auto size = std::uint64_t{size_};
  const std::uint64_t lines = 3 * (nodeCount_ + 1) + size / 32;
  const std::uint64_t most = kXmlFrame + 64 * (nodeCount_ + 1) + 5 * size + deepest_ * lines;
  return most <= kLargestXmlForm || xmlFormFits(root);
}

PropertyList Reader::read() {
  if (encoding_ == XmlEncoding::utf8) in_.take("\xEF\xBB\xBF");  // else the mark has gone already
  if (!in_.declaration(encoding_) || !in_.misc() || !in_.documentType() || !in_.misc() || !in_.rootTag())
    return {};
  constexpr XmlTag kRoot{"plist", "</plist>"};
  if (!content() || !in_.misc() || !in_.endTag(kRoot) || !in_.misc() || !in_.atEnd()) return {};
  const Node root = nodes_.front();
  if (!fits(root)) return {};
  const bool inArena = root.size != 0;
  return Access::make(root, inArena ? document_.handOver() : nullptr);
}

}  // namespace

PropertyList readXml(std::string_view bytes) {
  if (bytes.size() > kLargestXmlForm) return {};
  const XmlEncoding encoding = encodingOf(bytes);
  std::optional<std::string> converted;
  if (encoding == XmlEncoding::utf16) {
    converted = utf8OfUtf16(bytes);
    if (!converted || converted->size() > kLargestXmlForm) return {};
    bytes = *converted;
  }
  if (!hasOnlyXmlCharacters(bytes)) return {};
  return Reader(bytes, encoding).read();
}

}  // namespace brenvik::plist
