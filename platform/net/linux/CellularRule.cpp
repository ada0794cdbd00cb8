// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/CellularRule.h"

#include <net/if.h>
#include <netdb.h>
#include <strings.h>

#include <algorithm>
#include <array>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>
#include <utility>

#include "platform/net/linux/Routes.h"

namespace brenvik {
namespace {

std::string nameOfInterface(unsigned index) {
  std::array<char, IF_NAMESIZE> name{};
  return ::if_indextoname(index, name.data()) == nullptr ? std::string() : std::string(name.data());
}

bool isCellular(unsigned index, const CellularRuleFiles& files) {
  const std::string name = nameOfInterface(index);
  return name.empty() || isCellularInterface(name, files);
}

// Calls `visit(words)` for each line of a file of words, comments left out; `visit` returns false to stop.
template <typename Visit>
void forEachLine(const std::string& path, Visit visit) {
  std::ifstream file(path);
  std::string line;
  while (std::getline(file, line)) {
    line.resize(std::min(line.size(), line.find_first_of("#;")));
    std::istringstream words(line);
    if (!visit(words)) return;
  }
}

bool hostsFileHas(std::string_view host, const std::string& path) {
  const std::string wanted(host);
  bool found = false;
  forEachLine(path, [&](std::istringstream& words) {
    std::string word;
    words >> word;  // the address
    while (!found && words >> word) found = ::strcasecmp(word.c_str(), wanted.c_str()) == 0;
    return !found;
  });
  return found;
}

bool isCellularServer(const std::string& address, const CellularRuleFiles& files) {
  addrinfo hints{};
  hints.ai_flags = AI_NUMERICHOST;
  hints.ai_socktype = SOCK_DGRAM;
  addrinfo* list = nullptr;
  if (::getaddrinfo(address.c_str(), nullptr, &hints, &list) != 0) return false;  // the resolver skips it too
  const std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> owned(list, ::freeaddrinfo);
  const auto index = interfaceTo(*list->ai_addr);
  return index && isCellular(*index, files);
}

}  // namespace

bool isCellularInterface(std::string_view name, const CellularRuleFiles& files) noexcept try {
  if (name.starts_with("pdp_ip")) return true;
  std::ifstream file(files.interfaces + "/" + std::string(name) + "/uevent");
  std::string line;
  while (std::getline(file, line)) {
    if (line == "DEVTYPE=wwan") return true;
  }
  return false;
} catch (...) {
  return true;  // out of memory: on the safe side
}

ConnectionWay routeTo(const sockaddr& peer, const CellularRuleFiles& files) noexcept try {
  const auto index = interfaceTo(peer);
  if (!index) return {};
  std::string name = nameOfInterface(*index);
  if (name.empty()) return {};
  if (isCellularInterface(name, files)) return {ConnectionWay::Kind::cellular, {}};
  return {ConnectionWay::Kind::open, std::move(name)};
} catch (...) {
  return {};  // out of memory
}

bool mayLookUpName(std::string_view host, const CellularRuleFiles& files) noexcept try {
  const auto interfaces = interfacesWithRoutes();
  if (!interfaces) return false;
  const bool onlyCellular =
      !interfaces->empty() &&
      std::all_of(interfaces->begin(), interfaces->end(), [&](unsigned i) { return isCellular(i, files); });
  if (onlyCellular) return false;
  if (hostsFileHas(host, files.hosts)) return true;
  bool cellularServer = false;
  forEachLine(files.nameServers, [&](std::istringstream& words) {
    std::string keyword, address;
    if (words >> keyword >> address && keyword == "nameserver")
      cellularServer = isCellularServer(address, files);
    return !cellularServer;
  });
  return !cellularServer;
} catch (...) {
  return false;
}

}  // namespace brenvik
