// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <mutex>
#include <optional>
#include <string>

namespace brenvik {

// The shared country configuration. The code comes from its file; else from the last address that this
// process learned; else from the system's time zone, if that belongs to a country. Any thread.
class CountryConfiguration {
 public:
  struct Files {
    std::string configuration;  // a property list: a dictionary with the string CountryCode
    std::string localTime = "/etc/localtime";
    std::string timeZone = "/etc/timezone";
    std::string zoneTable = "/usr/share/zoneinfo/zone.tab";
  };

  // Reads nothing.
  explicit CountryConfiguration(Files files) : files_(std::move(files)) {}

  std::optional<std::string> countryCode();
  void setLastGeocoded(std::string countryCode);

 private:
  // Tells one state of a file from the next.
  struct Identity {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    timespec modified{};
    timespec changed{};
    bool operator==(const Identity& other) const noexcept;
  };

  void refreshConfiguration();
  std::optional<std::string> countryOfTimeZone();
  std::optional<std::string> countryOfZone(const std::string& zone) const;

  const Files files_;
  std::mutex mutex_;
  std::optional<Identity> identity_;  // of the configuration file that was read; none: there was no file
  std::optional<std::string> configured_;
  std::optional<std::string> lastGeocoded_;
  std::optional<std::string> zoneLink_;  // the target of the local time link whose country was looked up
  std::optional<std::string> zoneCountry_;
};

}  // namespace brenvik
