// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <string_view>

namespace brenvik {

// A log line without characters that could forge another line, control a terminal or change the order of the
// text. It writes these byte by byte as \xNN: control characters (U+0000 to U+001F, U+007F to U+009F),
// bidirectional controls (U+061C, U+200E, U+200F, U+202A to U+202E, U+2066 to U+2069), line and paragraph
// separators (U+2028, U+2029), and bytes that are not UTF-8. Everything else stays. Allocates nothing.
class EscapedLine {
 public:
  explicit EscapedLine(std::string_view line) noexcept;
  EscapedLine(const EscapedLine&) = delete;
  EscapedLine& operator=(const EscapedLine&) = delete;

  const char* text() const noexcept { return text_.data(); }
  std::string_view view() const noexcept { return {text_.data(), size_}; }

 private:
  // The longest line of the log with every byte escaped, in bytes.
  static constexpr std::size_t kMaxLength = 4 * 4096;

  void escape(std::string_view bytes) noexcept;
  void append(std::string_view bytes) noexcept;

  std::array<char, kMaxLength + 1> text_;
  std::size_t size_ = 0;
};

}  // namespace brenvik
