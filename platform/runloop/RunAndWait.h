// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "platform/runloop/WorkQueue.h"

namespace brenvik {

// Runs `work` on the queue and returns when it has run. If memory is short, it tries to post every 10 ms
// until it succeeds. For destructors and the like, which must complete. Do not call it on the queue itself;
// `work` must not throw.
void runAndWait(WorkQueue& queue, const WorkQueue::Task& work) noexcept;

}  // namespace brenvik
