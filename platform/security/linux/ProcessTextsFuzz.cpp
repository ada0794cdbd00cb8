// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What the kernel says of a caller, with parts that the caller chooses: its name in /proc/PID/stat, and the
// names of control groups that it may make in /proc/PID/cgroup. And any bytes in the place of either text.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/base/ProcessFacts.h"
#include "platform/security/linux/CallerProcess.h"

namespace {

using namespace brenvik;

void require(bool condition) {
  if (!condition) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string chosen(reinterpret_cast<const char*>(data), size);

  (void)parseProcessStat(chosen);
  const auto facts = parseProcessStat("42 (" + chosen +
                                      ") S 1 42 77 0 -1 4194560 100 0 0 0 1 2 0 0 20 0 1 0 987654 1000 10 "
                                      "18446744073709551615 0 0 0 0 0 0 0 0 0 0 0 0 17 1 0 0 0 0 0\n");
  require(facts && facts->state == 'S' && facts->session == 77 && facts->startTime == 987654);

  require(unitOfCgroups(chosen).find_first_of("/\n") == std::string_view::npos);
  require(unitOfCgroup(chosen).find('/') == std::string_view::npos);
  require(unitOfCgroup("/user.slice/" + chosen).empty());
  // The kernel makes no group whose name is empty or holds one of these.
  if (chosen.empty() || chosen.find_first_of("/\n") != std::string::npos) return 0;
  require(unitOfCgroup("/system.slice/some.service/" + chosen).empty());
  require(unitOfCgroups("0::/system.slice/some.service/" + chosen + "\n").empty());
  require(unitOfCgroups("1:name=systemd:/system.slice/own.service\n0::/user.slice/" + chosen + "\n").empty());
  // Other hierarchies of an old system are not asked.
  require(unitOfCgroups("7:cpu:/system.slice/" + chosen + "\n1:name=systemd:/system.slice/own.service\n") ==
          "own.service");
  return 0;
}
