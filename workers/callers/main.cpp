// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
// brenvik-caller-worker: tells the helper which programs its callers run. It has the capability that this
// takes, and is able to do nothing else with it: it opens no file.
#include <unistd.h>

#include "platform/log/linux/SystemLog.h"
#include "platform/security/linux/CallerFacts.h"
#include "platform/worker/linux/WorkerHost.h"
#include "workers/callers/CallerService.h"

int main() {
  // The same identifier as the helper's: whoever reads its log sees what became of its callers.
  brenvik::SystemLog log("BrenvikMobileHelper");
  brenvik::setLogSink(&log);
  const int status = brenvik::WorkerHost::run(
      {.service = brenvik::callers::kService, .rights = brenvik::callerRights(), .staysForTheNext = true},
      brenvik::serveCallers);
  ::_exit(status);
}
