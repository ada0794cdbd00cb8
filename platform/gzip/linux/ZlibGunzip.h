// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/gzip/Gunzip.h"

namespace brenvik {

// zlib's inflate with the gzip wrapper.
class ZlibGunzip final : public Gunzip {
 public:
  GunzipResult gunzip(std::span<const std::byte> input, std::uint64_t largestOutput,
                      const Receiver& receiver) noexcept override;
};

}  // namespace brenvik
