// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <mutex>
#include <string>

#include "helper/carrier/MobileAccount.h"

namespace brenvik {

// Decides which paths of a request may be touched. Two pure predicates: they look at most at the type of what
// stands at the path and change nothing. Paths are bytes: neither ".." nor links on the way are resolved.
// The account's home is taken once, at the first question; without a home the entries below it match nothing.
// Any thread. Memory exhaustion refuses the path.
class PathPolicy {
 public:
  explicit PathPolicy(MobileAccountSource account) : account_(std::move(account)) {}

  // True for exactly the 32 carrier and operator preference files and bundle links, unless a directory or a
  // FIFO stands there.
  bool isListedCarrierPath(const char* path) noexcept;

  // True for what begins with one of the two carrier bundle directories, for a listed path, and for a carrier
  // configuration package below "/tmp". A path of the last kind leaves the lines of a refusal in the log,
  // too.
  bool isAllowedCarrierPath(const char* path) noexcept;

 private:
  static constexpr std::size_t kEntries = 32;

  // Builds them when they are not there yet; false when there was no memory for it.
  bool hasTables() noexcept;
  void buildTables();

  const MobileAccountSource account_;
  std::mutex mutex_;
  bool built_ = false;
  bool hasHome_ = false;
  std::string homeBundlesDirectory_;          // empty without a home
  std::array<std::string, kEntries> listed_;  // in the order of the search; empty: matches nothing
};

}  // namespace brenvik
