// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// What proc(5) says about a caller, which chooses its own name and, below its unit, names of control groups:
// it must not be able to say another start time, session or unit than its own. The first byte chooses a line
// made here around a name from the input, or any text.
#include <string>

#include "platform/base/ProcessFacts.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/security/linux/CallerProcess.h"

namespace {

using namespace brenvik;

// Whatever the name is, the numbers are those that the kernel wrote.
void checkStat(FuzzInput& input) {
  const auto startTime = input.number(8);
  const auto session = static_cast<pid_t>(input.number(4) & 0x7FFFFFFF);
  const auto rest = input.rest();
  const std::string name(reinterpret_cast<const char*>(rest.data()), std::min<std::size_t>(rest.size(), 15));
  std::string text = "1234 (" + name + ") S 1 1234 " + std::to_string(session);
  for (int field = 7; field < 22; ++field) text += " 0";
  text += " " + std::to_string(startTime) + " 1000 2000\n";
  const auto facts = parseProcessStat(text);
  require(facts && facts->state == 'S' && facts->session == session);
  require(facts->startTime == static_cast<std::uint32_t>(startTime));
}

// A unit stands in slices of the system's manager only. What is below it says nothing.
void checkUnit(FuzzInput& input) {
  static constexpr std::string_view kOuter[]{"/system.slice/", "/user.slice/", "/", "/a.slice/system.slice/",
                                             "/x.service/"};
  const std::string_view outer = input.oneOf(kOuter);
  const auto rest = input.rest();
  std::string name(reinterpret_cast<const char*>(rest.data()), rest.size());
  std::erase(name, '\n');  // the kernel refuses such names
  const std::string text =
      "5:cpu:/other.service\n0::" + std::string(outer) + name + "\n1:name=systemd:/x.service\n";
  const std::string unit(unitOfCgroups(text));
  require(unit.find('/') == std::string::npos);
  const bool isForeign = outer == "/user.slice/" || outer == "/x.service/";
  if (isForeign) require(unit.empty());
  if (!isForeign && name.find('/') == std::string::npos) require(unit == name);
  // The directory right below the slice decides, unless it is a slice itself.
  const std::string first = name.substr(0, name.find('/'));
  if (first.size() < name.size() && !first.ends_with(".slice")) require(unit.empty());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  FuzzInput input(data, size);
  switch (input.byte() % 4) {
    case 0:
      checkStat(input);
      break;
    case 1:
      checkUnit(input);
      break;
    default: {
      const auto rest = input.rest();
      const std::string text(reinterpret_cast<const char*>(rest.data()), rest.size());
      (void)parseProcessStat(text);
      require(unitOfCgroups(text).size() <= text.size());
    }
  }
  return 0;
}
