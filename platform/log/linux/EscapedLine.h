// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstddef>
#include <string_view>

namespace brenvik {

// A finished log line in which nothing is left that could forge another line, drive a terminal or show the
// text in another order than it has. Written as \xNN, byte by byte, are the controls (U+0000 to U+001F,
// U+007F to U+009F), the bidirectional ones (U+061C, U+200E, U+200F, U+202A to U+202E, U+2066 to U+2069), the
// line and paragraph separators (U+2028, U+2029), and bytes that are not UTF-8. Everything else stays.
// Allocates nothing.
class EscapedLine {
 public:
  explicit EscapedLine(std::string_view line) noexcept;
  EscapedLine(const EscapedLine&) = delete;
  EscapedLine& operator=(const EscapedLine&) = delete;

  const char* text() const noexcept { return text_.data(); }
  std::string_view view() const noexcept { return {text_.data(), size_}; }

 private:
  // The longest line of the log, with all of it escaped.
  static constexpr std::size_t kMaxLength = 4 * 4096;

  void escape(std::string_view bytes) noexcept;
  void append(std::string_view bytes) noexcept;

  std::array<char, kMaxLength + 1> text_;
  std::size_t size_ = 0;
};

}  // namespace brenvik
