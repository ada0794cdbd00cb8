// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/Questions.h"

#include <algorithm>

#include "interface/Routines.h"

namespace brenvik::client {
namespace {

consteval std::int32_t idOf(std::string_view name) {
  return std::find_if(kRequestRoutines.begin(), kRequestRoutines.end(),
                      [&](const RoutineFacts& each) { return each.name == name; })
      ->id;
}

constexpr std::int32_t kCivicInfo = idOf("BVMobileHelperRequestCountryCodeFromLocation");
constexpr std::int32_t kLocalAddress = idOf("BVMobileHelperRequestWanIPFromLocation");

}  // namespace

bool Questions::isQuestion(std::int32_t routine) noexcept {
  return routine == kCivicInfo || routine == kLocalAddress;
}

Questions::Kind* Questions::kindOf(std::int32_t routine) noexcept {
  return routine == kCivicInfo ? &kinds_[0] : routine == kLocalAddress ? &kinds_[1] : nullptr;
}

void Questions::asked(std::int32_t routine, bvmh_call number, Time now) noexcept {
  Kind* const kind = kindOf(routine);
  if (kind == nullptr) return;
  // A request that is sent once more is still the same.
  if (number != 0) refused(routine, number);
  Question* const oldest =
      std::min_element(kind->begin(), kind->end(), [](const Question& a, const Question& b) {
        return (a.isOpen ? a.time : Time::min()) < (b.isOpen ? b.time : Time::min());
      });
  *oldest = {true, number, now};
}

void Questions::refused(std::int32_t routine, bvmh_call number) noexcept {
  Kind* const kind = kindOf(routine);
  if (kind == nullptr) return;
  const auto found = std::find_if(kind->begin(), kind->end(),
                                  [&](const Question& each) { return each.isOpen && each.number == number; });
  if (found != kind->end()) *found = {};
}

std::int32_t Questions::answered(bvmh_event_kind push, Time now, bvmh_call* number) noexcept {
  if (number != nullptr) *number = 0;
  if (push != BVMH_EVENT_CIVIC_INFO && push != BVMH_EVENT_LOCAL_ADDRESS) return BVMH_ERROR_NOT_ASKED;
  Kind& kind = *kindOf(push == BVMH_EVENT_CIVIC_INFO ? kCivicInfo : kLocalAddress);
  const auto isOpen = [&](const Question& each) { return each.isOpen && now - each.time <= kAnswerTime; };
  const auto open = std::count_if(kind.begin(), kind.end(), isOpen);
  if (open == 1 && number != nullptr) *number = std::find_if(kind.begin(), kind.end(), isOpen)->number;
  kind = {};
  return open == 0 ? BVMH_ERROR_NOT_ASKED : open == 1 ? BVMH_OK : BVMH_ERROR_AMBIGUOUS;
}

}  // namespace brenvik::client
