// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/carrier/PathPolicy.h"

#include <sys/stat.h>

#include <cstring>
#include <string_view>

#include "platform/log/Log.h"

namespace brenvik {
namespace {

// As much of a path as any comparison looks at: the largest path field of a request.
constexpr std::size_t kComparedBytes = 1024;

constexpr const char* kLibrary = "/Library/";
constexpr const char* kPreferences = "/Library/Preferences/";
constexpr const char* kHomeBundles = "/Library/Carrier Bundles/";
constexpr const char* kFixedHome = "/private/var/mobile";
// No trailing slash, so names that merely begin like it are allowed as well. Clients count on it.
constexpr const char* kFixedBundlesDirectory = "/private/var/mobile/Library/Carrier Bundles";
constexpr const char* kPackageDirectory = "/tmp";
constexpr std::string_view kPackageExtension = ".tcpk";
constexpr const char* kPropertyListExtension = ".plist";

constexpr std::array kDomains{"com.norvale.carrier",         "com.norvale.carrier_1",
                              "com.norvale.carrier_2",       "com.norvale.operator",
                              "com.norvale.operator_1",      "com.norvale.operator_2",
                              "com.norvale.carrier.default", "com.norvale.carrier.bootstrap"};
constexpr std::array kBundles{"Carrier Bundle.bundle",  "Carrier1Bundle.bundle",  "Carrier2Bundle.bundle",
                              "Operator Bundle.bundle", "Operator1Bundle.bundle", "Operator2Bundle.bundle",
                              "CarrierDefault.bundle",  "CarrierBootstrap.bundle"};

std::string_view comparedPart(const char* path) { return {path, ::strnlen(path, kComparedBytes)}; }

}  // namespace

void PathPolicy::buildTables() {
  const MobileAccount account = account_();
  // An empty home would put the entries below the root directory, where nothing of the account lives.
  hasHome_ = account.home != nullptr && account.home[0] != '\0';
  const std::string home = hasHome_ ? account.home : "";
  const std::string fixedHome = kFixedHome;
  std::size_t row = 0;
  for (const bool fixed : {false, true}) {
    const std::string& base = fixed ? fixedHome : home;
    for (const char* domain : kDomains) {
      if (fixed || hasHome_) listed_[row] = base + kPreferences + domain + kPropertyListExtension;
      ++row;
    }
    for (const char* bundle : kBundles) {
      if (fixed || hasHome_) listed_[row] = base + kLibrary + bundle;
      ++row;
    }
  }
  if (hasHome_) homeBundlesDirectory_ = home + kHomeBundles;
}

bool PathPolicy::hasTables() noexcept {
  const std::lock_guard lock(mutex_);
  try {
    if (!built_) buildTables();
    built_ = true;
  } catch (...) {
    // Out of memory.
  }
  return built_;
}

bool PathPolicy::isListedCarrierPath(const char* path) noexcept {
  if (!hasTables()) return false;
  struct stat info {};
  // The bits of a symbolic link's type, tested and not compared: links, regular files, devices and sockets
  // share one with it and go on; directories and FIFOs share none and are refused.
  if (::lstat(path, &info) == 0 && (info.st_mode & 0xA000) == 0) return false;
  for (const std::string& entry : listed_) {
    if (entry.empty() || std::strncmp(path, entry.c_str(), kComparedBytes) != 0) continue;
    logUnified(LogLevel::info, "%s is within allowed path %s", path, entry.c_str());
    return true;
  }
  return false;
}

bool PathPolicy::isAllowedCarrierPath(const char* path) noexcept {
  if (!hasTables()) return false;
  const std::string_view compared = comparedPart(path);
  if (hasHome_ && compared.starts_with(homeBundlesDirectory_)) {
    logUnified(LogLevel::info, "Allowing path %s within %s", path, homeBundlesDirectory_.c_str());
    return true;
  }
  if (compared.starts_with(kFixedBundlesDirectory)) {
    logUnified(LogLevel::info, "Allowing path %s within %s", path, kFixedBundlesDirectory);
    return true;
  }
  if (isListedCarrierPath(path)) return true;
  // Written before the package test: a package's path leaves them in the log although it is accepted.
  logUnified(LogLevel::error, "NOT Allowing path %s as it isn't within the wild card directories:", path);
  logUnified(LogLevel::error, "%s", homeBundlesDirectory_.c_str());
  logUnified(LogLevel::error, "%s", kFixedBundlesDirectory);
  if (!compared.starts_with(kPackageDirectory)) return false;
  // Only the first occurrence counts, so that a package inside a package is refused.
  const std::size_t found = compared.find(kPackageExtension);
  return found != std::string_view::npos && found + kPackageExtension.size() == std::strlen(path);
}

}  // namespace brenvik
