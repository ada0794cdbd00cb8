// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "tools/bvhelperctl/Outcome.h"
#include "tools/support/Parameters.h"

// What each command does, in the order of the table: checks its values, checks in, calls its routine, and
// makes an outcome of the answer. All of them throw UsageError, before they connect, and std::bad_alloc.
// Waiting.h and Switches.h have those that take more than one call.
namespace brenvik::tools {

Outcome ping(bvmh_client* client, const Values& values);
Outcome setPreference(bvmh_client* client, const Values& values);
Outcome getPreference(bvmh_client* client, const Values& values);
Outcome getAppPreference(bvmh_client* client, const Values& values);
Outcome deletePreference(bvmh_client* client, const Values& values);
Outcome loadPropertyList(bvmh_client* client, const Values& values);
Outcome setVoicemailToken(bvmh_client* client, const Values& values);
Outcome showVoicemailToken(bvmh_client* client, const Values& values);
Outcome clearVoicemailToken(bvmh_client* client, const Values& values);
Outcome resetVoicemailStore(bvmh_client* client, const Values& values);
Outcome showVoicemailSubscription(bvmh_client* client, const Values& values);
Outcome replaceCarrierLink(bvmh_client* client, const Values& values);
Outcome createLink(bvmh_client* client, const Values& values);
Outcome removeCarrierFile(bvmh_client* client, const Values& values);
Outcome copyCarrierFile(bvmh_client* client, const Values& values);
Outcome copyCrashLogs(bvmh_client* client, const Values& values);
Outcome moveBundle(bvmh_client* client, const Values& values);
Outcome unpackArchive(bvmh_client* client, const Values& values);
Outcome showCountry(bvmh_client* client, const Values& values);
Outcome showBadges(bvmh_client* client, const Values& values);
Outcome showLocalizedLabels(bvmh_client* client, const Values& values);
Outcome remapChannel(bvmh_client* client, const Values& values);

}  // namespace brenvik::tools
