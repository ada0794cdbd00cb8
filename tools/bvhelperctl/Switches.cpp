// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/Switches.h"

#include <dlfcn.h>
#include <net/if.h>
#include <systemd/sd-bus.h>

#include <charconv>
#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "tools/bvhelperctl/Call.h"
#include "tools/bvhelperctl/HelperProcess.h"
#include "tools/support/EventStream.h"

namespace brenvik::tools {
namespace {

// ---- the heartbeat --------------------------------------------------------------------------------------

constexpr const char* kCellularInterface = "pdp_ip0";
// Whether a process with these facts (of /proc/PID/status) may send an echo: by its groups or by CAP_NET_RAW.
bool maySendEchoes(const std::string& status, std::uint32_t leastGroup, std::uint32_t greatestGroup) {
  constexpr unsigned kCapNetRaw = 13;
  for (const std::string& each : wordsAfter(status, "CapEff:")) {
    std::uint64_t capabilities = 0;
    (void)std::from_chars(each.data(), each.data() + each.size(), capabilities,
                          16);  // 0 is left when it is none
    if ((capabilities >> kCapNetRaw & 1) != 0) return true;
  }
  for (const char* name : {"Gid:", "Groups:"}) {
    for (const std::string& each : wordsAfter(status, name)) {
      const auto group = numberIn<std::uint32_t>(each);
      if (group && *group >= leastGroup && *group <= greatestGroup) return true;
    }
  }
  return false;
}

// True when a helper runs, and none that runs may send an echo.
bool isEchoForbidden() {
  const std::vector<std::string> range = wordsAfter(factsIn("/proc/sys/net/ipv4/ping_group_range"), "");
  if (range.size() != 2) return false;
  const auto least = numberIn<std::uint32_t>(range[0]).value_or(1);
  const auto greatest = numberIn<std::uint32_t>(range[1]).value_or(0);
  bool isForbidden = false;
  for (const HelperProcess& each : helperProcesses()) {
    if (maySendEchoes(each.status, least, greatest)) return false;
    isForbidden = true;
  }
  return isForbidden;
}

// ---- the radio manager ----------------------------------------------------------------------------------

// What is needed of libsystemd, which is loaded for this one command only: every other one would pay for it
// at each start.
struct BusLibrary {
  decltype(&sd_bus_open_system) open = nullptr;
  decltype(&sd_bus_is_ready) isReady = nullptr;
  decltype(&sd_bus_process) process = nullptr;
  decltype(&sd_bus_wait) wait = nullptr;
  decltype(&sd_bus_set_method_call_timeout) setTimeout = nullptr;
  decltype(&sd_bus_call_method) call = nullptr;
  decltype(&sd_bus_message_read) read = nullptr;
  decltype(&sd_bus_message_enter_container) enter = nullptr;
  decltype(&sd_bus_message_skip) skip = nullptr;
  decltype(&sd_bus_message_exit_container) leave = nullptr;
  decltype(&sd_bus_message_unref) unrefMessage = nullptr;
  decltype(&sd_bus_close_unref) close = nullptr;

  bool load() {
    void* library = ::dlopen("libsystemd.so.0", RTLD_NOW | RTLD_LOCAL);  // stays until the end
    if (library == nullptr) return false;
    const auto find = [&](auto& function, const char* name) {
      function = reinterpret_cast<std::remove_reference_t<decltype(function)>>(::dlsym(library, name));
      return function != nullptr;
    };
    return find(open, "sd_bus_open_system") && find(isReady, "sd_bus_is_ready") &&
           find(process, "sd_bus_process") && find(wait, "sd_bus_wait") &&
           find(setTimeout, "sd_bus_set_method_call_timeout") && find(call, "sd_bus_call_method") &&
           find(read, "sd_bus_message_read") && find(enter, "sd_bus_message_enter_container") &&
           find(skip, "sd_bus_message_skip") && find(leave, "sd_bus_message_exit_container") &&
           find(unrefMessage, "sd_bus_message_unref") && find(close, "sd_bus_close_unref");
  }
};

constexpr double kBusPatience = 2;  // seconds
constexpr const char* kModemManager = "org.freedesktop.ModemManager1";

// What keeps the radio manager from being told; empty when nothing does, or when that cannot be found out.
std::string whyNoRadioLogs() {
  BusLibrary library;
  if (!library.load()) return "";
  sd_bus* opened = nullptr;
  if (library.open(&opened) < 0) return "there is no system bus: no radio manager was told";
  const std::unique_ptr<sd_bus, decltype(library.close)> bus(opened, library.close);
  // Neither may keep the user waiting: a bus that is silent while it lets us in, nor one that does not
  // answer.
  const Patience patience(kBusPatience);
  while (library.isReady(opened) == 0 && !patience.isOver()) {
    const int handled = library.process(opened, nullptr);
    if (handled < 0) return "";
    const auto left = std::chrono::microseconds(std::chrono::milliseconds(patience.milliseconds()));
    if (handled == 0 && library.wait(opened, static_cast<std::uint64_t>(left.count())) < 0) return "";
  }
  if (library.isReady(opened) <= 0)
    return "the system bus does not answer: no radio manager may have been told";
  (void)library.setTimeout(opened,
                           static_cast<std::uint64_t>(kBusPatience * 1e6));  // else a longer one holds
  const auto call = [&](const char* service, const char* path, const char* interface, const char* method,
                        const char* types, auto... arguments) {
    sd_bus_message* reply = nullptr;
    (void)library.call(opened, service, path, interface, method, nullptr, &reply, types, arguments...);
    return std::unique_ptr<sd_bus_message, decltype(library.unrefMessage)>(reply, library.unrefMessage);
  };

  const auto owned = call("org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                          "NameHasOwner", "s", kModemManager);
  int hasOwner = 0;
  if (owned == nullptr || library.read(owned.get(), "b", &hasOwner) < 0) return "";
  if (hasOwner == 0) return "ModemManager is not running: no radio manager was told";

  const auto objects = call(kModemManager, "/org/freedesktop/ModemManager1",
                            "org.freedesktop.DBus.ObjectManager", "GetManagedObjects", "");
  if (objects == nullptr || library.enter(objects.get(), 'a', "{oa{sa{sv}}}") < 0) return "";
  // Greater than 0 while there is an entry; one is enough.
  return library.enter(objects.get(), 'e', "oa{sa{sv}}") == 0 ? "ModemManager knows no modem" : "";
}

}  // namespace

Outcome switchHeartbeat(bvmh_client* client, const Values& values) {
  const bool isOn = values["STATE"] == "on";
  BVHELPERCTL_CALL(BVMobileHelperCellularHeartbeat, client, isOn ? 1 : 0);
  Outcome outcome = did(name, code, "cellular heartbeat " + values["STATE"]);
  if (code != BVMH_OK || !isOn) return outcome;
  if (::if_nametoindex(kCellularInterface) == 0) {
    outcome.notes.push_back(std::string("there is no interface ") + kCellularInterface +
                            ": the echoes take the default route");
  }
  if (isEchoForbidden()) {
    outcome.notes.emplace_back(
        "the helper may not send echoes: it lacks CAP_NET_RAW, and net.ipv4.ping_group_range leaves its "
        "groups "
        "out");
  }
  return outcome;
}

Outcome switchRadioLogs(bvmh_client* client, const Values& values) {
  const bool isOn = values["STATE"] == "on";
  BVHELPERCTL_CALL(BVMobileHelperEnableRadioManagerLogs, client, isOn ? 1 : 0);
  Outcome outcome = did(name, code, "radio manager logs " + values["STATE"]);
  if (code != BVMH_OK || !isOn) return outcome;
  if (std::string why = whyNoRadioLogs(); !why.empty()) outcome.notes.push_back(std::move(why));
  return outcome;
}

}  // namespace brenvik::tools
