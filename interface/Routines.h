// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <string_view>

#include "interface/Messages.h"

// One row for each routine: the conditions that a request must meet before its routine runs, and the form of
// its reply. Handlers, client, command line, fuzzers and the protocol's table all use these rows.
namespace brenvik {

enum class ReplyForm : std::uint8_t { status, integer, string64, string256, outOfLine, checkIn };

constexpr std::size_t sizeOfReply(ReplyForm form) noexcept {
  // Sizes in bytes, in the order of the forms.
  constexpr std::array sizes{sizeof(StatusReply),    sizeof(IntegerReply),   sizeof(String64Reply),
                             sizeof(String256Reply), sizeof(OutOfLineReply), sizeof(CheckInReply)};
  static_assert(sizes.size() == static_cast<std::size_t>(ReplyForm::checkIn) + 1);
  return sizes[static_cast<std::size_t>(form)];
}

struct RoutineFacts {
  std::int32_t id;
  std::string_view name;
  std::uint32_t requestSize;    // bytes, without in-line regions
  std::uint32_t descriptors;    // 0: a simple request; else a complex one with exactly this many
  std::uint32_t lengthsOffset;  // complex: where the body repeats the descriptors' sizes, u32 each, in order
  ReplyForm reply;
};

inline constexpr RoutineFacts kCheckInRoutine{4792174, "BVMobileHelperCheckIn", sizeof(CheckInRequest), 1,
                                              0,       ReplyForm::checkIn};

inline constexpr std::int32_t kFirstRequestId = 8683549;

inline constexpr std::array kRequestRoutines{
    RoutineFacts{8683549, "BVMobileHelperSetVoicemailToken", sizeof(String256Request), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683550, "BVMobileHelperSetVoicemailTokenForKey", sizeof(TwoStrings256Request), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683551, "BVMobileHelperClearVoicemailToken", sizeof(EmptyRequest), 0, 0, ReplyForm::status},
    RoutineFacts{8683552, "BVMobileHelperResetVoicemailStore", sizeof(EmptyRequest), 0, 0, ReplyForm::status},
    RoutineFacts{8683553, "BVMobileHelperCopyVoicemailTokenForKey", sizeof(String256Request), 0, 0,
                 ReplyForm::string256},
    RoutineFacts{8683554, "BVMobileHelperCopyVoicemailToken", sizeof(EmptyRequest), 0, 0,
                 ReplyForm::string256},
    RoutineFacts{8683555, "BVMobileHelperSetPreferenceValue", sizeof(SetPreferenceValueRequest), 1,
                 offsetof(SetPreferenceValueRequest, valueLength), ReplyForm::status},
    RoutineFacts{8683556, "BVMobileHelperCopyPreferenceValue", sizeof(TwoStrings256Request), 0, 0,
                 ReplyForm::outOfLine},
    RoutineFacts{8683557, "BVMobileHelperCopyAppPreferenceValue", sizeof(TwoStrings256Request), 0, 0,
                 ReplyForm::outOfLine},
    RoutineFacts{8683558, "BVMobileHelperReplaceCarrierSymlink", sizeof(ThreeStrings1024Request), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683559, "BVMobileHelperCreateSymlink", sizeof(TwoStrings1024Request), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683560, "BVMobileHelperRemoveCarrierFile", sizeof(TwoStrings1024Request), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683561, "BVMobileHelperIsVoicemailServiceSubscribed", sizeof(EmptyRequest), 0, 0,
                 ReplyForm::integer},
    RoutineFacts{8683562, "BVMobileHelperCellularHeartbeat", sizeof(IntegerRequest), 0, 0, ReplyForm::status},
    RoutineFacts{8683563, "BVMobileHelperCheckLASDUpdate", sizeof(IntegerRequest), 0, 0, ReplyForm::status},
    RoutineFacts{8683564, "BVMobileHelperCopyCarrierFile", sizeof(ThreeStrings256Request), 0, 0,
                 ReplyForm::integer},
    RoutineFacts{8683565, "BVMobileHelperCopyCrashLogs", sizeof(String256Request), 0, 0, ReplyForm::integer},
    RoutineFacts{8683566, "BVMobileHelperMoveIntoCarrierBundles", sizeof(ThreeStrings256Request), 0, 0,
                 ReplyForm::integer},
    RoutineFacts{8683567, "BVMobileHelperRequestCountryCodeFromLocation", sizeof(CoordinateRequest), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683568, "BVMobileHelperCopyCountryCode", sizeof(EmptyRequest), 0, 0, ReplyForm::string64},
    RoutineFacts{8683569, "BVMobileHelperRequestWanIPFromLocation", sizeof(EmptyRequest), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683570, "BVMobileHelperEnableRadioManagerLogs", sizeof(IntegerRequest), 0, 0,
                 ReplyForm::status},
    RoutineFacts{8683571, "BVMobileHelperUnpackArchive", sizeof(TwoStrings256Request), 0, 0,
                 ReplyForm::integer},
    RoutineFacts{8683572, "BVMobileHelperLoadPlistFile", sizeof(String256Request), 0, 0,
                 ReplyForm::outOfLine},
    RoutineFacts{8683573, "BVMobileHelperCopyBadgeLabels", sizeof(LabelsRequest), 2,
                 offsetof(LabelsRequest, labelsLength), ReplyForm::outOfLine},
    RoutineFacts{8683574, "BVMobileHelperCopyLocalizedLabels", sizeof(LabelsRequest), 2,
                 offsetof(LabelsRequest, labelsLength), ReplyForm::outOfLine},
    RoutineFacts{8683575, "BVMobileHelperRemapContactsChannel", sizeof(TwoStrings64Request), 0, 0,
                 ReplyForm::integer},
};
static_assert(kRequestRoutines.size() == 27);
// The dispatch indexes the table by id, so the rows are in the order of their ids, without gaps.
static_assert([] {
  for (std::size_t i = 0; i < kRequestRoutines.size(); ++i) {
    if (kRequestRoutines[i].id != kFirstRequestId + static_cast<std::int32_t>(i)) return false;
  }
  return true;
}());

// Largest messages declared for the two tables, in bytes.
inline constexpr std::uint32_t kCheckInLargestMessage = sizeof(CheckInReply);
inline constexpr std::uint32_t kRequestLargestReply = sizeof(String256Reply);
static_assert(kCheckInLargestMessage == 40 && kRequestLargestReply == 292);

}  // namespace brenvik
