// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlWriter.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstring>
#include <memory>
#include <string_view>
#include <vector>

#include "platform/base/Base64.h"
#include "platform/plist/internal/Dates.h"
#include "platform/plist/internal/Document.h"

namespace brenvik::plist {
namespace {

// How a byte of text leaves: as it is, as one of four references, after a look at the two bytes behind it
// (U+FFFE and U+FFFF begin with EF), or not at all.
enum ByteClass : std::uint8_t { plain, ampersand, less, greater, carriageReturn, lookAhead, forbidden };

constexpr std::array<std::uint8_t, 256> kByteClasses = [] {
  std::array<std::uint8_t, 256> classes{};
  for (std::size_t i = 0; i < 0x20; ++i) classes[i] = forbidden;
  classes['\t'] = plain;
  classes['\n'] = plain;
  // A reader turns a bare carriage return into a line feed.
  classes['\r'] = carriageReturn;
  classes['&'] = ampersand;
  classes['<'] = less;
  classes['>'] = greater;
  classes[0xEF] = lookAhead;
  return classes;
}();

constexpr std::string_view kReferences[] = {"", "&amp;", "&lt;", "&gt;", "&#13;"};
constexpr std::size_t kLongestReference = 5;

bool isNonCharacter(const char* bytes) noexcept {
  return bytes[0] == '\xEF' && bytes[1] == '\xBF' && static_cast<unsigned char>(bytes[2]) >= 0xBE;
}

// Eight bytes that can be copied as they are; now and then false for such bytes too.
bool allPlain(std::uint64_t word) noexcept {
  constexpr std::uint64_t kOnes = 0x0101010101010101ULL;
  constexpr std::uint64_t kTops = 0x8080808080808080ULL;
  auto zeroIn = [](std::uint64_t bytes) { return (bytes - kOnes) & ~bytes; };
  const std::uint64_t control = (word - kOnes * 0x20) & ~word;
  const std::uint64_t angle = zeroIn((word | kOnes * 2) ^ kOnes * '>');
  const std::uint64_t amp = zeroIn(word ^ kOnes * '&');
  const std::uint64_t lookAheads = zeroIn(word ^ kOnes * 0xEF);
  return ((control | angle | amp | lookAheads) & kTops) == 0;
}

std::uint64_t load64(const char* bytes) noexcept {
  std::uint64_t word;
  std::memcpy(&word, bytes, sizeof word);
  return word;
}

// Longest form of a number or a date.
constexpr std::size_t kScalarRoom = 32;

char* formatReal(char* to, double number) noexcept {
  // The sign of what is not a number means nothing to a reader.
  if (std::isnan(number)) number = std::abs(number);
  return std::to_chars(to, to + kScalarRoom, number).ptr;
}

std::uint64_t escapedSize(const Node& text) noexcept {
  std::uint64_t size = text.size;
  for (std::size_t i = 0; i < text.size; ++i) {
    const std::uint8_t kind = kByteClasses[static_cast<unsigned char>(text.text[i])];
    if (kind >= ampersand && kind <= carriageReturn) size += kReferences[kind].size() - 1;
  }
  return size;
}

class Writer {
 public:
  std::optional<std::string> write(const Node& root);

 private:
  // Ever so many bytes at cursor_ afterwards; at most kBuffer.
  void reserve(std::size_t bytes) {
    if (static_cast<std::size_t>(buffer_.get() + kBuffer - cursor_) < bytes) flush();
  }
  void flush();
  template <std::size_t size>
  void put(const char (&text)[size]) {
    std::memcpy(cursor_, text, size - 1);
    cursor_ += size - 1;
  }
  void indent() {
    // Nearly always so few that a call would cost more.
    if (depth_ <= 8) {
      std::memcpy(cursor_, "\t\t\t\t\t\t\t\t", 8);
    } else {
      std::memset(cursor_, '\t', depth_);
    }
    cursor_ += depth_;
  }
  void text(const Node& node);
  void plainText(const char*& from, const char* pieceBegin, const char* pieceEnd);
  void character(const char* from, const char* end);
  void data(const Node& node);
  void scalar(const Node& node);
  void keyElement(const Node& node);

  static constexpr std::size_t kBuffer = std::size_t{32} << 10;
  // Room for an indented tag or two and a number between.
  static constexpr std::size_t kElementRoom = kMaxPropertyListDepth + 96;
  // Text is escaped in pieces, so that one check of the room does for a piece.
  static constexpr std::size_t kPiece = 2048;

  std::string out_;
  std::unique_ptr<char[]> buffer_{new char[kBuffer]};
  char* cursor_ = buffer_.get();
  std::size_t depth_ = 0;
  bool failed_ = false;
};

void Writer::flush() {
  const auto used = static_cast<std::size_t>(cursor_ - buffer_.get());
  cursor_ = buffer_.get();
  if (failed_) return;
  if (out_.size() + used > kLargestXmlForm) {
    failed_ = true;
    return;
  }
  const std::size_t size = out_.size() + used;
  // Grown in few and large steps: pages not written to cost nothing, and copies do. What fits one buffer, as
  // nearly everything does, gets its own size.
  if (out_.capacity() < size) {
    out_.reserve(out_.empty() ? size : std::min(kLargestXmlForm, std::max(size, out_.capacity() * 4)));
  }
  out_.append(buffer_.get(), used);
}

void Writer::text(const Node& node) {
  const char* from = node.text;
  const char* const end = from + node.size;
  while (from != end && !failed_) {
    const char* const pieceEnd = static_cast<std::size_t>(end - from) > kPiece ? from + kPiece : end;
    reserve(kPiece * kLongestReference + 8);
    const char* const pieceBegin = from;
    while (from < pieceEnd) {
      plainText(from, pieceBegin, pieceEnd);
      for (int i = 0; i < 8 && from < pieceEnd; ++i, ++from) character(from, end);
    }
  }
}

// Copies as much as can be copied eight bytes at a time.
void Writer::plainText(const char*& from, const char* pieceBegin, const char* pieceEnd) {
  char* to = cursor_;
  while (pieceEnd - from >= 8) {
    const std::uint64_t word = load64(from);
    if (!allPlain(word)) break;
    std::memcpy(to, &word, sizeof word);
    from += 8;
    to += 8;
  }
  // The last few bytes go together with some before them, which, being plain, stand before `to` already.
  if (const auto left = pieceEnd - from; left < 8 && pieceEnd - pieceBegin >= 8) {
    if (const std::uint64_t word = load64(pieceEnd - 8); allPlain(word)) {
      std::memcpy(to + left - 8, &word, sizeof word);
      to += left;
      from = pieceEnd;
    }
  }
  cursor_ = to;
}

void Writer::character(const char* from, const char* end) {
  const std::uint8_t kind = kByteClasses[static_cast<unsigned char>(*from)];
  if (kind >= ampersand && kind <= carriageReturn) {
    std::memcpy(cursor_, kReferences[kind].data(), kReferences[kind].size());
    cursor_ += kReferences[kind].size();
    return;
  }
  if (kind == forbidden || (kind == lookAhead && end - from >= 3 && isNonCharacter(from))) failed_ = true;
  *cursor_++ = *from;
}

void Writer::data(const Node& node) {
  put("<data>\n");
  const char* from = node.text;
  for (std::size_t left = node.size; left != 0 && !failed_;) {
    const std::size_t line = left < kDataBytesPerLine ? left : kDataBytesPerLine;
    reserve(kElementRoom);
    indent();
    cursor_ = encodeBase64(from, line, cursor_);
    *cursor_++ = '\n';
    from += line;
    left -= line;
  }
  reserve(kElementRoom);
  indent();
  put("</data>\n");
}

void Writer::keyElement(const Node& node) {
  reserve(kElementRoom);
  indent();
  put("<key>");
  text(node);
  reserve(kElementRoom);
  put("</key>\n");
}

void Writer::scalar(const Node& node) {
  reserve(kElementRoom);
  indent();
  switch (node.tag) {
    case Tag::string:
      put("<string>");
      text(node);
      reserve(kElementRoom);
      put("</string>\n");
      return;
    case Tag::integer:
      put("<integer>");
      cursor_ = std::to_chars(cursor_, cursor_ + kScalarRoom, node.integer).ptr;
      put("</integer>\n");
      return;
    case Tag::unsignedInteger:
      put("<integer>");
      cursor_ = std::to_chars(cursor_, cursor_ + kScalarRoom, node.unsignedInteger).ptr;
      put("</integer>\n");
      return;
    case Tag::boolean:
      if (node.integer != 0) {
        put("<true/>\n");
      } else {
        put("<false/>\n");
      }
      return;
    case Tag::real:
      put("<real>");
      cursor_ = formatReal(cursor_, node.real);
      put("</real>\n");
      return;
    case Tag::date:
      put("<date>");
      if (char* const end = formatDate(cursor_, node.real); end != nullptr) {
        cursor_ = end;
      } else {
        failed_ = true;
      }
      put("</date>\n");
      return;
    case Tag::data:
      data(node);
      return;
    case Tag::array:
      put("<array/>\n");
      return;
    case Tag::dictionary:
      put("<dict/>\n");
      return;
    case Tag::none:
    case Tag::foreign:
    case Tag::pending:
      failed_ = true;
      return;
  }
}

std::optional<std::string> Writer::write(const Node& root) {
  struct Frame {
    const Node* next;
    const Node* end;
    bool isDictionary;
  };
  std::vector<Frame> frames;
  put(kXmlHead);
  const Node* value = &resolved(root);
  while (!failed_) {
    if (value->isContainer() && frames.size() == kMaxPropertyListDepth) return std::nullopt;
    if (value->isContainer() && value->size != 0) {
      const bool isDictionary = value->tag == Tag::dictionary;
      reserve(kElementRoom);
      indent();
      if (isDictionary) {
        put("<dict>\n");
      } else {
        put("<array>\n");
      }
      frames.push_back({value->children, value->children + value->childCount(), isDictionary});
      ++depth_;
    } else {
      scalar(*value);
    }
    while (!frames.empty() && frames.back().next == frames.back().end) {
      --depth_;
      reserve(kElementRoom);
      indent();
      if (frames.back().isDictionary) {
        put("</dict>\n");
      } else {
        put("</array>\n");
      }
      frames.pop_back();
    }
    if (frames.empty()) break;
    Frame& frame = frames.back();
    if (frame.isDictionary) keyElement(*frame.next++);
    value = &resolved(*frame.next++);
  }
  reserve(kElementRoom);
  put(kXmlTail);
  flush();
  if (failed_) return std::nullopt;
  return std::move(out_);
}

}  // namespace

std::optional<std::string> writeXml(const Node& root) { return Writer().write(root); }

XmlExtent xmlExtentOfKey(const Node& key) noexcept { return {12 + escapedSize(key), 1}; }

XmlExtent xmlExtentOf(const Node& node) noexcept {
  char form[kScalarRoom];
  auto lengthTo = [&form](const char* end) { return static_cast<std::uint64_t>(end - form); };
  switch (node.tag) {
    case Tag::string:
      return {18 + escapedSize(node), 1};
    case Tag::integer:
      return {20 + lengthTo(std::to_chars(form, form + sizeof form, node.integer).ptr), 1};
    case Tag::unsignedInteger:
      return {20 + lengthTo(std::to_chars(form, form + sizeof form, node.unsignedInteger).ptr), 1};
    case Tag::real:
      return {14 + lengthTo(formatReal(form, node.real)), 1};
    case Tag::date:
      return {34, 1};
    case Tag::boolean:
      return {node.integer != 0 ? std::uint64_t{8} : std::uint64_t{9}, 1};
    case Tag::data: {
      const std::uint64_t lines = (std::uint64_t{node.size} + kDataBytesPerLine - 1) / kDataBytesPerLine;
      return {15 + base64Size(node.size) + lines, 2 + lines};
    }
    case Tag::array:
      return {9, 1};
    case Tag::dictionary:
      return {8, 1};
    case Tag::none:
    case Tag::foreign:
    case Tag::pending:
      break;
  }
  return {};
}

}  // namespace brenvik::plist
