// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <mutex>
#include <string>

#include "helper/carrier/MobileAccount.h"

namespace brenvik {

// Decides which paths of a request may be touched. Both predicates change nothing and look at most at the
// type of the item at the path. Paths are compared as bytes: neither ".." nor links are resolved. The first
// call looks up the account's home; without a home, the entries below it match nothing. Any thread. A lack of
// memory refuses the path.
class PathPolicy {
 public:
  explicit PathPolicy(MobileAccountSource account) : account_(std::move(account)) {}

  // True for exactly the 32 carrier and operator preference files and bundle links, unless a directory or a
  // FIFO stands there.
  bool isListedCarrierPath(const char* path) noexcept;

  // True for a path that begins with one of the two carrier bundle directories, for a listed path, and for a
  // carrier configuration package below "/tmp". A package, although allowed, still logs the lines of a
  // refusal.
  bool isAllowedCarrierPath(const char* path) noexcept;

 private:
  static constexpr std::size_t kEntries = 32;

  // Builds the tables if they are missing; false if memory runs out.
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
