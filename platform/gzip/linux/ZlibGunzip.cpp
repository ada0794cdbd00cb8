// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/gzip/linux/ZlibGunzip.h"

#include <zlib.h>

#include <algorithm>
#include <limits>
#include <memory>
#include <new>

#include "platform/base/WriteAll.h"

namespace brenvik {
namespace {

// One write of this size costs little beside the inflating of it, and the second-level cache holds it.
constexpr std::size_t kPiece = 256 * 1024;
constexpr int kGzipWrapper = 15 + 16;  // largest window, gzip header and trailer expected

struct InflateEnd {
  void operator()(z_stream* stream) const noexcept { (void)::inflateEnd(stream); }
};

uInt clamped(std::size_t size) noexcept {
  return static_cast<uInt>(std::min<std::size_t>(size, std::numeric_limits<uInt>::max()));
}

}  // namespace

GunzipResult ZlibGunzip::gunzip(std::span<const std::byte> input, std::uint64_t largestOutput,
                                const Receiver& receiver) {
  z_stream stream{};
  if (::inflateInit2(&stream, kGzipWrapper) != Z_OK) return GunzipResult::outOfMemory;
  const std::unique_ptr<z_stream, InflateEnd> owned(&stream);
  // Left as it is: zeroing what inflate is about to fill would cost for nothing.
  const std::unique_ptr<std::byte[]> piece(new std::byte[kPiece]);

  std::uint64_t produced = 0;
  for (;;) {
    const uInt offered = clamped(input.size());
    stream.next_in = reinterpret_cast<Bytef*>(const_cast<std::byte*>(input.data()));
    stream.avail_in = offered;
    stream.next_out = reinterpret_cast<Bytef*>(piece.get());
    stream.avail_out = kPiece;
    const int result = ::inflate(&stream, Z_NO_FLUSH);
    if (result != Z_OK && result != Z_STREAM_END && result != Z_BUF_ERROR) {
      return result == Z_MEM_ERROR ? GunzipResult::outOfMemory : GunzipResult::damaged;
    }
    input = input.subspan(offered - stream.avail_in);
    const std::size_t size = kPiece - stream.avail_out;
    if (size > largestOutput - produced) return GunzipResult::tooLarge;
    produced += size;
    if (size > 0 && !receiver(std::span(piece.get(), size))) return GunzipResult::refused;
    if (result == Z_STREAM_END) {
      if (input.empty()) return GunzipResult::whole;
      // Either another member follows, or bytes that do not belong here; the next header tells.
      if (::inflateReset(&stream) != Z_OK) return GunzipResult::damaged;
    } else if (input.empty() && size < kPiece) {
      return GunzipResult::truncated;
    }
  }
}

GunzipOutcome ZlibGunzip::gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                                     std::uint64_t largestOutput) noexcept {
  return gunzipInto(input, file, room, largestOutput, nullptr);
}

GunzipOutcome ZlibGunzip::gunzipInto(const GunzipInput& input, int file, std::uint64_t room,
                                     std::uint64_t largestOutput,
                                     const std::function<bool()>& mayGoOn) noexcept try {
  GunzipOutcome outcome;
  outcome.result = gunzip(input.bytes, largestOutput, [&](std::span<const std::byte> output) {
    outcome.size += output.size();
    if (outcome.size <= room) outcome.writeError = writeAll(file, output);
    return outcome.writeError == 0 && (!mayGoOn || mayGoOn());
  });
  return outcome;
} catch (const std::bad_alloc&) {
  return {GunzipResult::outOfMemory, 0, 0};
}

}  // namespace brenvik
