// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// Runs `work` on the queue and returns when it has run. It gets its turn however long memory is short:
// posting is tried again every 10 ms. For the end of objects that somebody else waits for. Not on the queue
// itself; `work` throws nothing.
void runAndWait(WorkQueue& queue, const WorkQueue::Task& work) noexcept;

}  // namespace brenvik
