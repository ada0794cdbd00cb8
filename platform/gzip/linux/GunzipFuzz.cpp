// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <zlib.h>

#include <array>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <string>

#include "platform/gzip/linux/ZlibGunzip.h"

using namespace brenvik;

namespace {

constexpr std::size_t kMaxSize = 20'000;

// The plain way: each member at once into memory. Nothing when it is not whole or too large.
std::optional<std::string> atOnce(const std::uint8_t* data, std::size_t size) {
  std::string output;
  if (size == 0) return std::nullopt;
  while (size > 0) {
    static std::array<char, kMaxSize + 1> member;
    z_stream stream{};
    if (::inflateInit2(&stream, 15 + 16) != Z_OK) return std::nullopt;
    stream.next_in = const_cast<Bytef*>(data);
    stream.avail_in = static_cast<uInt>(size);
    stream.next_out = reinterpret_cast<Bytef*>(member.data());
    stream.avail_out = static_cast<uInt>(member.size());
    const int result = ::inflate(&stream, Z_FINISH);
    output.append(member.data(), stream.total_out);
    data += stream.total_in;
    size -= stream.total_in;
    ::inflateEnd(&stream);
    if (result != Z_STREAM_END || output.size() > kMaxSize) return std::nullopt;
  }
  return output;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  ZlibGunzip gunzip;
  const std::span input(reinterpret_cast<const std::byte*>(data), size);
  std::string output;
  const auto take = [&](std::span<const std::byte> piece) {
    output.append(reinterpret_cast<const char*>(piece.data()), piece.size());
    return true;
  };
  const GunzipResult result = gunzip.gunzip(input, kMaxSize, take);
  if (output.size() > kMaxSize) std::abort();
  const auto expected = atOnce(data, size);
  if ((result == GunzipResult::whole) != expected.has_value()) std::abort();
  if (expected && *expected != output) std::abort();
  if (result == GunzipResult::whole && !output.empty()) {
    const std::size_t length = output.size();
    output.clear();
    if (gunzip.gunzip(input, length - 1, take) != GunzipResult::tooLarge) std::abort();
    if (output.size() >= length) std::abort();
  }
  return 0;
}
