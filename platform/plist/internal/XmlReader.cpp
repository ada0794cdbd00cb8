// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlReader.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "platform/base/Utf8.h"
#include "platform/plist/internal/Calendar.h"
#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/Text.h"
#include "platform/plist/internal/XmlEncoding.h"
#include "platform/plist/internal/XmlSize.h"

namespace brenvik::plist {
namespace {

bool isSpace(char c) noexcept { return c == ' ' || c == '\n' || c == '\t' || c == '\r'; }
bool isDigit(char c) noexcept { return c >= '0' && c <= '9'; }
bool isLetter(char c) noexcept { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }

std::string_view trimmed(std::string_view text) noexcept {
  while (!text.empty() && isSpace(text.front())) text.remove_prefix(1);
  while (!text.empty() && isSpace(text.back())) text.remove_suffix(1);
  return text;
}

// Production 2 of XML 1.0 for the whole document at once; what follows may then look for markup only.
bool hasOnlyXmlCharacters(std::string_view bytes) noexcept {
  unsigned char high = 0;
  unsigned char control = 0;
  // No way out in the middle: the compiler turns this into wide instructions.
  for (const char byte : bytes) {
    const auto c = static_cast<unsigned char>(byte);
    high = static_cast<unsigned char>(high | c);
    control = static_cast<unsigned char>(control | ((c < 0x20) & (c != '\t') & (c != '\n') & (c != '\r')));
  }
  if (control != 0) return false;
  if (high < 0x80) return true;
  if (!isValidUtf8(bytes)) return false;
  for (std::size_t at = bytes.find("\xEF\xBF"); at != std::string_view::npos;
       at = bytes.find("\xEF\xBF", at + 3)) {
    if (static_cast<unsigned char>(bytes[at + 2]) >= 0xBE) return false;
  }
  return true;
}

bool isXmlCharacter(std::uint32_t c) noexcept {
  if (c < 0x20) return c == '\t' || c == '\n' || c == '\r';
  return c <= 0xD7FF || (c >= 0xE000 && c <= 0xFFFD) || (c >= 0x10000 && c <= 0x10FFFF);
}

void appendUtf8(std::string& to, std::uint32_t c) {
  if (c < 0x80) {
    to.push_back(static_cast<char>(c));
    return;
  }
  if (c < 0x800) {
    to.push_back(static_cast<char>(0xC0 | c >> 6));
  } else {
    if (c < 0x10000) {
      to.push_back(static_cast<char>(0xE0 | c >> 12));
    } else {
      to.push_back(static_cast<char>(0xF0 | c >> 18));
      to.push_back(static_cast<char>(0x80 | (c >> 12 & 0x3F)));
    }
    to.push_back(static_cast<char>(0x80 | (c >> 6 & 0x3F)));
  }
  to.push_back(static_cast<char>(0x80 | (c & 0x3F)));
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

bool readDate(std::string_view text, Node& node) noexcept {
  constexpr std::string_view kForm = "0000-00-00T00:00:00Z";
  if (text.size() != kForm.size()) return false;
  for (std::size_t i = 0; i < kForm.size(); ++i) {
    if (kForm[i] == '0' ? !isDigit(text[i]) : text[i] != kForm[i]) return false;
  }
  auto number = [text](std::size_t at, std::size_t width) {
    int value = 0;
    for (std::size_t i = at; i < at + width; ++i) value = value * 10 + (text[i] - '0');
    return value;
  };
  const std::chrono::year_month_day day{std::chrono::year{number(0, 4)},
                                        std::chrono::month{static_cast<unsigned>(number(5, 2))},
                                        std::chrono::day{static_cast<unsigned>(number(8, 2))}};
  const int hour = number(11, 2);
  const int minute = number(14, 2);
  const int second = number(17, 2);
  if (!day.ok() || day.year() < std::chrono::year{1} || hour > 23 || minute > 59 || second > 59) return false;
  node.tag = Tag::date;
  node.real = static_cast<double>(secondsSinceDayZero(day) + hour * 3600L + minute * 60L + second);
  return true;
}

constexpr std::uint8_t kBase64Space = 64;
constexpr std::uint8_t kBase64End = 65;
constexpr std::uint8_t kBase64Bad = 66;
constexpr std::array<std::uint8_t, 256> kBase64Values = [] {
  std::array<std::uint8_t, 256> values{};
  values.fill(kBase64Bad);
  constexpr std::string_view kDigits = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  for (std::size_t i = 0; i < kDigits.size(); ++i) {
    values[static_cast<unsigned char>(kDigits[i])] = static_cast<std::uint8_t>(i);
  }
  for (const char c : {' ', '\t', '\n', '\r'}) values[static_cast<unsigned char>(c)] = kBase64Space;
  values['='] = kBase64End;
  return values;
}();

// Returns the end of what was written, at most 3/4 of the text, or null.
char* decodeBase64(std::string_view text, char* to) noexcept {
  const auto* from = reinterpret_cast<const unsigned char*>(text.data());
  const auto* const end = from + text.size();
  std::uint32_t group = 0;
  int held = 0;
  int padding = 0;
  while (from != end) {
    while (held == 0 && end - from >= 4) {
      const std::uint32_t a = kBase64Values[from[0]];
      const std::uint32_t b = kBase64Values[from[1]];
      const std::uint32_t c = kBase64Values[from[2]];
      const std::uint32_t d = kBase64Values[from[3]];
      if ((a | b | c | d) >= kBase64Space) break;
      if (padding != 0) return nullptr;
      const std::uint32_t four = a << 18 | b << 12 | c << 6 | d;
      to[0] = static_cast<char>(four >> 16);
      to[1] = static_cast<char>(four >> 8);
      to[2] = static_cast<char>(four);
      to += 3;
      from += 4;
    }
    if (from == end) break;
    const std::uint32_t value = kBase64Values[*from++];
    if (value == kBase64Space) continue;
    if (value == kBase64Bad) return nullptr;
    if (value == kBase64End) {
      // One or two, where they complete a group.
      if (held + padding < 2 || ++padding + held > 4) return nullptr;
      continue;
    }
    if (padding != 0) return nullptr;
    group = group << 6 | value;
    if (++held == 4) {
      to[0] = static_cast<char>(group >> 16);
      to[1] = static_cast<char>(group >> 8);
      to[2] = static_cast<char>(group);
      to += 3;
      held = 0;
    }
  }
  if (held == 0) return padding == 0 ? to : nullptr;
  if (held + padding != 4 || held == 1) return nullptr;
  if (held == 2) {
    *to++ = static_cast<char>(group >> 4);
  } else {
    *to++ = static_cast<char>(group >> 10);
    *to++ = static_cast<char>(group >> 2);
  }
  return to;
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

struct Spelling {
  std::string_view name;
  std::string_view endTag;
};
constexpr Spelling kSpellings[] = {{"array", "</array>"}, {"data", "</data>"},   {"date", "</date>"},
                                   {"dict", "</dict>"},   {"false", "</false>"}, {"integer", "</integer>"},
                                   {"key", "</key>"},     {"real", "</real>"},   {"string", "</string>"},
                                   {"true", "</true>"}};
constexpr const Spelling& spellingOf(Element element) noexcept {
  return kSpellings[static_cast<std::size_t>(element)];
}

constexpr std::uint64_t kOnes = 0x0101010101010101ULL;
constexpr std::uint64_t kTops = 0x8080808080808080ULL;

// Where plain text stops to be copied as it is: at < & > or a carriage return.
bool stopsText(char c) noexcept { return c == '<' || c == '&' || c == '>' || c == '\r'; }

const char* endOfPlainText(const char* at, const char* end) noexcept {
  auto zeroIn = [](std::uint64_t bytes) { return (bytes - kOnes) & ~bytes; };
  // Eight bytes at a time up to those among which there is a stop. (There may be none after all.)
  while (end - at >= 8) {
    std::uint64_t word;
    std::memcpy(&word, at, sizeof word);
    const std::uint64_t angle = zeroIn((word | kOnes * 2) ^ kOnes * '>');
    if (((angle | zeroIn(word ^ kOnes * '&') | zeroIn(word ^ kOnes * '\r')) & kTops) == 0) {
      at += 8;
      continue;
    }
    for (int i = 0; i < 8; ++i, ++at) {
      if (stopsText(*at)) return at;
    }
  }
  while (at != end && !stopsText(*at)) ++at;
  return at;
}

class Reader {
 public:
  // The bytes are UTF-8; `encoding` is what the document came in.
  Reader(std::string_view bytes, XmlEncoding encoding)
      : encoding_(encoding),
        begin_(bytes.data()),
        cursor_(begin_),
        end_(begin_ + bytes.size()),
        document_(std::min(bytes.size() + 64, kFirstBlock)) {}
  PropertyList read();

 private:
  static constexpr std::size_t kFirstBlock = std::size_t{64} << 10;
  enum class Form { open, empty, wrong };

  std::size_t left() const noexcept { return static_cast<std::size_t>(end_ - cursor_); }
  bool take(std::string_view text) noexcept {
    if (left() < text.size() || std::memcmp(cursor_, text.data(), text.size()) != 0) return false;
    cursor_ += text.size();
    return true;
  }
  bool take(char c) noexcept {
    if (cursor_ == end_ || *cursor_ != c) return false;
    ++cursor_;
    return true;
  }
  // True when there was any.
  bool space() noexcept {
    const char* const from = cursor_;
    while (cursor_ != end_ && isSpace(*cursor_)) ++cursor_;
    return cursor_ != from;
  }
  bool skipBehind(std::string_view mark) noexcept {
    const std::string_view rest(cursor_, left());
    const std::size_t at = rest.find(mark);
    if (at == std::string_view::npos) return false;
    cursor_ += at + mark.size();
    return true;
  }

  bool declaration();
  bool pseudoAttribute(std::string_view name, std::string_view& value);
  bool literal(std::string_view& value);
  bool comment();
  bool instruction();
  bool misc();
  bool documentType();
  bool rootTag();
  bool endTag(std::string_view name);
  bool endTag(Element element);
  Element elementName() noexcept;
  Form tagEnd();
  bool content();
  bool beginContainer(bool isDictionary);
  bool endContainer();
  bool scalar(Element element);
  bool text(Element element, std::string_view& value);
  bool textWithMarkup(Element element, std::string_view& value);
  bool reference();
  void appendLines(std::string_view text);
  void textNode(std::string_view text, Node& node);
  bool dataNode(std::string_view text, Node& node);
  bool fits(const Node& root) const;

  const XmlEncoding encoding_;
  const char* begin_;
  const char* cursor_;
  const char* end_;
  DocumentHolder document_;

  struct Frame {
    std::size_t base;  // of its children among nodes_
    bool isDictionary;
  };
  std::vector<Frame> frames_;
  std::vector<Node> nodes_;  // children of what is open, keys included
  std::size_t nodeCount_ = 0;
  std::size_t deepest_ = 0;
  std::string scratch_;
};

bool Reader::literal(std::string_view& value) {
  if (cursor_ == end_ || (*cursor_ != '"' && *cursor_ != '\'')) return false;
  const char quote = *cursor_++;
  const char* const from = cursor_;
  while (cursor_ != end_ && *cursor_ != quote) ++cursor_;
  value = {from, static_cast<std::size_t>(cursor_ - from)};
  return take(quote);
}

bool Reader::pseudoAttribute(std::string_view name, std::string_view& value) {
  if (!take(name)) return false;
  space();
  if (!take('=')) return false;
  space();
  return literal(value);
}

bool Reader::declaration() {
  if (left() < 6 || std::memcmp(cursor_, "<?xml", 5) != 0 || !isSpace(cursor_[5])) return true;
  cursor_ += 5;
  std::string_view value;
  space();
  if (!pseudoAttribute("version", value) || value != "1.0") return false;
  bool spaced = space();
  if (spaced && cursor_ != end_ && *cursor_ == 'e') {
    if (!pseudoAttribute("encoding", value) || !mayDeclare(encoding_, value)) return false;
    if (isUsAscii(value) && !isAscii(cursor_, left())) return false;
    spaced = space();
  }
  if (spaced && cursor_ != end_ && *cursor_ == 's') {
    if (!pseudoAttribute("standalone", value) || (value != "yes" && value != "no")) return false;
    space();
  }
  return take("?>");
}

// Behind "<!--".
bool Reader::comment() { return skipBehind("--") && take('>'); }

// Behind "<?".
bool Reader::instruction() {
  const char* const from = cursor_;
  while (cursor_ != end_ &&
         (isLetter(*cursor_) || *cursor_ == '_' ||
          (cursor_ != from && (isDigit(*cursor_) || *cursor_ == '-' || *cursor_ == '.')))) {
    ++cursor_;
  }
  const std::string_view target(from, static_cast<std::size_t>(cursor_ - from));
  if (target.empty()) return false;
  if (target.size() == 3 && (target[0] | 0x20) == 'x' && (target[1] | 0x20) == 'm' &&
      (target[2] | 0x20) == 'l') {
    return false;
  }
  return take("?>") || (space() && skipBehind("?>"));
}

// White space, comments and instructions; false when one of them is malformed.
bool Reader::misc() {
  while (true) {
    space();
    if (left() < 2 || cursor_[0] != '<') return true;
    if (cursor_[1] == '?') {
      cursor_ += 2;
      if (!instruction()) return false;
    } else if (cursor_[1] == '!') {
      if (!take("<!--")) return true;
      if (!comment()) return false;
    } else {
      return true;
    }
  }
}

// Accepted and never fetched; an internal part, where entities would be declared, is not.
bool Reader::documentType() {
  if (!take("<!DOCTYPE")) return true;
  if (!space() || !take("plist")) return false;
  if (space()) {
    std::string_view value;
    if (take("PUBLIC")) {
      if (!space() || !literal(value)) return false;
      for (const char c : value) {
        if (!isLetter(c) && !isDigit(c) &&
            std::string_view(" \r\n-'()+,./:=?;!*#@$_%").find(c) == std::string_view::npos) {
          return false;
        }
      }
      if (!space() || !literal(value)) return false;
    } else if (take("SYSTEM")) {
      if (!space() || !literal(value)) return false;
    }
    space();
  }
  return take('>');
}

// The format defines one attribute, the root's version, whose value nobody looks at.
bool Reader::rootTag() {
  if (!take("<plist")) return false;
  if (space() && cursor_ != end_ && *cursor_ == 'v') {
    std::string_view value;
    if (!pseudoAttribute("version", value) || value.find_first_of("<&") != std::string_view::npos)
      return false;
    space();
  }
  return take('>');
}

bool Reader::endTag(std::string_view name) {
  if (!take("</") || !take(name)) return false;
  space();
  return take('>');
}

bool Reader::endTag(Element element) {
  const Spelling& spelling = spellingOf(element);
  return take(spelling.endTag) || endTag(spelling.name);  // the second for space within
}

// Behind "<"; the byte behind the name is for tagEnd() to judge.
Element Reader::elementName() noexcept {
  // Something must follow: the end of the root at least.
  if (left() < 8) return Element::unknown;
  Element candidate = Element::unknown;
  switch (*cursor_) {
    case 'a':
      candidate = Element::array;
      break;
    case 'd':
      candidate = cursor_[1] == 'i' ? Element::dictionary : cursor_[3] == 'a' ? Element::data : Element::date;
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
  return take(spellingOf(candidate).name) ? candidate : Element::unknown;
}

Reader::Form Reader::tagEnd() {
  if (take('>')) return Form::open;
  space();
  if (take('>')) return Form::open;
  return take("/>") ? Form::empty : Form::wrong;
}

bool Reader::reference() {
  ++cursor_;
  if (take("lt;")) {
    scratch_.push_back('<');
  } else if (take("gt;")) {
    scratch_.push_back('>');
  } else if (take("amp;")) {
    scratch_.push_back('&');
  } else if (take("quot;")) {
    scratch_.push_back('"');
  } else if (take("apos;")) {
    scratch_.push_back('\'');
  } else {
    if (!take('#')) return false;
    const int base = take('x') ? 16 : 10;
    std::uint32_t character = 0;
    const auto [stop, error] = std::from_chars(cursor_, end_, character, base);
    if (error != std::errc() || !isXmlCharacter(character)) return false;
    cursor_ = stop;
    if (!take(';')) return false;
    appendUtf8(scratch_, character);
  }
  return true;
}

// Every line end becomes a line feed.
void Reader::appendLines(std::string_view text) {
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '\r') {
      scratch_.push_back(text[i]);
    } else if (i + 1 == text.size() || text[i + 1] != '\n') {
      scratch_.push_back('\n');
    }
  }
}

// Character data up to and with the end tag. The view lies in the document or in scratch_.
bool Reader::text(Element element, std::string_view& value) {
  const char* const from = cursor_;
  cursor_ = endOfPlainText(from, end_);
  value = {from, static_cast<std::size_t>(cursor_ - from)};
  if (left() >= 2 && cursor_[0] == '<' && cursor_[1] == '/') return endTag(element);
  scratch_.assign(value);
  return textWithMarkup(element, value);
}

bool Reader::textWithMarkup(Element element, std::string_view& value) {
  while (cursor_ != end_) {
    switch (*cursor_) {
      case '&':
        if (!reference()) return false;
        break;
      case '\r':
        ++cursor_;
        scratch_.push_back('\n');
        take('\n');
        break;
      case '>':
        // The end of a marked section, without one. (An element's tags stand before: there are two bytes.)
        if (cursor_[-1] == ']' && cursor_[-2] == ']') return false;
        scratch_.push_back('>');
        ++cursor_;
        break;
      case '<':
        if (left() >= 2 && cursor_[1] == '/') {
          value = scratch_;
          return endTag(element);
        }
        if (take("<![CDATA[")) {
          const char* const from = cursor_;
          if (!skipBehind("]]>")) return false;
          appendLines({from, static_cast<std::size_t>(cursor_ - from) - 3});
        } else if (take("<!--")) {
          if (!comment()) return false;
        } else if (!take("<?") || !instruction()) {
          return false;
        }
        break;
      default: {
        const char* const from = cursor_;
        cursor_ = endOfPlainText(from, end_);
        scratch_.append(from, cursor_);
        break;
      }
    }
  }
  return false;
}

void Reader::textNode(std::string_view text, Node& node) {
  node.tag = Tag::string;
  node.size = static_cast<std::uint32_t>(text.size());
  node.text = text.empty() ? "" : document_->copyText(text.data(), text.size());
}

bool Reader::dataNode(std::string_view text, Node& node) {
  node.tag = Tag::data;
  node.text = "";
  char* const to = document_->allocateText(text.size() / 4 * 3 + 3);
  char* const stop = decodeBase64(text, to);
  document_->trim(stop == nullptr ? to : stop);
  if (stop == nullptr) return false;
  node.size = static_cast<std::uint32_t>(stop - to);
  if (node.size != 0) node.text = to;
  return true;
}

bool Reader::scalar(Element element) {
  const Form form = tagEnd();
  if (form == Form::wrong) return false;
  Node& node = nodes_.emplace_back();
  if (element == Element::yes || element == Element::no) {
    node.tag = Tag::boolean;
    node.integer = element == Element::yes ? 1 : 0;
    return form == Form::empty || endTag(element);
  }
  std::string_view value;
  if (form == Form::open && !text(element, value)) return false;
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
    case Element::date:
      return readDate(value, node);
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
  const Form form = tagEnd();
  if (form == Form::wrong || frames_.size() == kDeepestPropertyList) return false;
  frames_.push_back({nodes_.size(), isDictionary});
  deepest_ = std::max(deepest_, frames_.size());
  return form == Form::open || endContainer();
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

// The one value of the document, which becomes nodes_[0].
bool Reader::content() {
  do {
    if (!misc() || left() < 2 || *cursor_ != '<') return false;
    if (cursor_[1] == '/') {
      if (frames_.empty()) return false;
      const Element open = frames_.back().isDictionary ? Element::dictionary : Element::array;
      if (!endTag(open) || !endContainer()) return false;
      continue;
    }
    ++cursor_;
    const Element element = elementName();
    if (element == Element::unknown) return false;
    const bool keyWanted =
        !frames_.empty() && frames_.back().isDictionary && (nodes_.size() - frames_.back().base) % 2 == 0;
    if (keyWanted != (element == Element::key)) return false;
    if (element == Element::dictionary || element == Element::array) {
      if (!beginContainer(element == Element::dictionary)) return false;
    } else if (!scalar(element)) {
      return false;
    }
  } while (!frames_.empty());
  return true;
}

// The form that we would write may be larger than the one we read: it is indented.
bool Reader::fits(const Node& root) const {
  const auto size = static_cast<std::uint64_t>(end_ - begin_);
  const std::uint64_t lines = 3 * (nodeCount_ + 1) + size / 32;
  const std::uint64_t most = kXmlFrame + 64 * (nodeCount_ + 1) + 5 * size + deepest_ * lines;
  return most <= kLargestXmlForm || xmlFormFits(root);
}

PropertyList Reader::read() {
  if (encoding_ == XmlEncoding::utf8) take("\xEF\xBB\xBF");  // else the mark has gone already
  if (!declaration() || !misc() || !documentType() || !misc() || !rootTag()) return {};
  if (!content() || !misc() || !endTag("plist") || !misc() || cursor_ != end_) return {};
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
