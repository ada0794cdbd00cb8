// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/gzip/fakes/GzipOf.h"

#include <zlib.h>

#include <cstdlib>

namespace brenvik {

std::string gzipOf(const std::string& content) {
  z_stream stream{};
  constexpr int kGzipHeader = 16;
  if (::deflateInit2(&stream, 6, Z_DEFLATED, MAX_WBITS + kGzipHeader, 8, Z_DEFAULT_STRATEGY) != Z_OK)
    std::abort();
  std::string result(::deflateBound(&stream, content.size()) + 64, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(content.data()));
  stream.avail_in = static_cast<uInt>(content.size());
  stream.next_out = reinterpret_cast<Bytef*>(result.data());
  stream.avail_out = static_cast<uInt>(result.size());
  if (::deflate(&stream, Z_FINISH) != Z_STREAM_END) std::abort();
  result.resize(stream.total_out);
  ::deflateEnd(&stream);
  return result;
}

}  // namespace brenvik
