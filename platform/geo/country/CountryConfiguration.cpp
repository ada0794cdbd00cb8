// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/geo/country/CountryConfiguration.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <filesystem>
#include <span>
#include <string_view>

#include "platform/base/UniqueFd.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

// Both files are small; what is larger is something else.
constexpr std::size_t kLargestFile = std::size_t{64} << 10;
// A link of local time leads to a zone, or by way of an alias or two.
constexpr int kMaxLinks = 8;

// The content of a regular file of moderate size, and what fstat(2) says of it.
std::optional<std::string> readFile(const std::string& path, struct stat* status) {
  // Non-blocking: a FIFO in the file's place must not hold the caller up.
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!file.isValid() || ::fstat(file.get(), status) != 0 || !S_ISREG(status->st_mode)) return std::nullopt;
  std::string content(kLargestFile + 1, '\0');
  std::size_t size = 0;
  while (size < content.size()) {
    const ssize_t got = ::read(file.get(), content.data() + size, content.size() - size);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return std::nullopt;
    if (got == 0) break;
    size += static_cast<std::size_t>(got);
  }
  if (size > kLargestFile) return std::nullopt;
  content.resize(size);
  return content;
}

std::optional<std::string> readLink(const std::string& path) {
  std::string target(PATH_MAX, '\0');
  const ssize_t size = ::readlink(path.c_str(), target.data(), target.size());
  if (size <= 0) return std::nullopt;
  target.resize(static_cast<std::size_t>(size));
  return target;
}

// The zone's name within the time zone database, or nothing when the path is not one of it.
std::optional<std::string> zoneNameIn(std::string_view path) {
  constexpr std::string_view kDatabase = "/zoneinfo/";
  const auto at = path.rfind(kDatabase);
  if (at == std::string_view::npos) return std::nullopt;
  path.remove_prefix(at + kDatabase.size());
  for (const std::string_view variant : {"posix/", "right/"}) {
    if (path.starts_with(variant)) path.remove_prefix(variant.size());
  }
  return std::string(path);
}

bool sameTime(const timespec& a, const timespec& b) noexcept {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

}  // namespace

bool CountryConfiguration::Identity::operator==(const Identity& other) const noexcept {
  return device == other.device && inode == other.inode && size == other.size &&
         sameTime(modified, other.modified) && sameTime(changed, other.changed);
}

void CountryConfiguration::setLastGeocoded(std::string countryCode) {
  const std::lock_guard lock(mutex_);
  lastGeocoded_ = std::move(countryCode);
}

std::optional<std::string> CountryConfiguration::countryCode() {
  const std::lock_guard lock(mutex_);
  refreshConfiguration();
  if (configured_) return configured_;
  if (lastGeocoded_) return lastGeocoded_;
  return countryOfTimeZone();
}

void CountryConfiguration::refreshConfiguration() {
  const auto identityOf = [](const struct stat& status) {
    return Identity{status.st_dev, status.st_ino, status.st_size, status.st_mtim, status.st_ctim};
  };
  struct stat status {};
  if (::stat(files_.configuration.c_str(), &status) != 0) {
    identity_.reset();
    configured_.reset();
    return;
  }
  if (identity_ == identityOf(status)) return;
  // Known only when it has been read to its end: memory may run out on the way.
  identity_.reset();
  configured_.reset();
  Identity identity = identityOf(status);
  errno = 0;
  const auto content = readFile(files_.configuration, &status);
  if (!content && (errno == EMFILE || errno == ENFILE || errno == ENOMEM)) {
    return;  // the want is ours and passes; the file is read when it is asked for next
  }
  if (content) {
    identity = identityOf(status);
    const PropertyList file = parsePropertyList(std::as_bytes(std::span(*content)));
    const PropertyList value = file.find("CountryCode");
    if (const auto code = value.asString(); code && !code->empty()) configured_ = *code;
  }
  identity_ = identity;
  if (!configured_)
    logUnified(LogLevel::error, "geo service: the country configuration names no country code");
}

std::optional<std::string> CountryConfiguration::countryOfTimeZone() {
  auto path = files_.localTime;
  auto target = readLink(path);
  if (!target) {
    // A copy instead of a link: the name may stand beside it.
    struct stat status {};
    auto name = readFile(files_.timeZone, &status);
    if (!name) return std::nullopt;
    while (!name->empty() && (name->back() == '\n' || name->back() == ' ')) name->pop_back();
    return countryOfZone(*name);
  }
  if (target == zoneLink_) return zoneCountry_;
  const auto link = target;
  std::optional<std::string> country;
  // Step by step: zones of two countries may be links to one file, and the first name is the one that was
  // chosen.
  for (int links = 0; target && links < kMaxLinks && !country; ++links) {
    path = target->starts_with('/') ? *target : path.substr(0, path.rfind('/') + 1) + *target;
    // A relative alias climbs within the database: its name is what is left of the detour.
    path = std::filesystem::path(path).lexically_normal();
    if (const auto zone = zoneNameIn(path)) country = countryOfZone(*zone);
    target = readLink(path);
  }
  zoneLink_ = link;
  zoneCountry_ = std::move(country);
  return zoneCountry_;
}

// The zone's line in the table: country code, coordinates, zone name, maybe comments, separated by tabs.
std::optional<std::string> CountryConfiguration::countryOfZone(const std::string& zone) const {
  struct stat status {};
  const auto table = readFile(files_.zoneTable, &status);
  if (!table || zone.empty()) return std::nullopt;
  std::string_view rest = *table;
  while (!rest.empty()) {
    std::string_view line = rest.substr(0, rest.find('\n'));
    rest.remove_prefix(std::min(rest.size(), line.size() + 1));
    if (line.starts_with('#')) continue;
    const auto first = line.find('\t');
    const auto second = line.find('\t', first == std::string_view::npos ? first : first + 1);
    if (second == std::string_view::npos) continue;
    const std::string_view name = line.substr(second + 1, line.find('\t', second + 1) - second - 1);
    if (name == zone) return std::string(line.substr(0, first));
  }
  return std::nullopt;
}

}  // namespace brenvik
