// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/BegunCalls.h"

#include <iterator>

namespace brenvik::client {

BegunCalls::List& BegunCalls::listOf(const BegunCall& call) noexcept {
  switch (call.state) {
    case BegunCall::State::waiting:
      return waiting_;
    case BegunCall::State::sent:
      return sent_;
    case BegunCall::State::finished:
      break;
  }
  return finished_;
}

BegunCalls::Place BegunCalls::add(bvmh_call number) {
  List made;
  made.emplace_back();
  made.front().result.call = number;
  byNumber_.emplace(number, made.begin());
  made.front().place = made.begin();
  waiting_.splice(waiting_.end(), made);
  return std::prev(waiting_.end());
}

BegunCall* BegunCalls::find(bvmh_call number) noexcept {
  const auto found = byNumber_.find(number);
  return found == byNumber_.end() ? nullptr : &*found->second;
}

void BegunCalls::remove(BegunCall& call) noexcept {
  byNumber_.erase(call.result.call);
  listOf(call).erase(call.place);
}

void BegunCalls::markSent(Place waiting) noexcept {
  waiting->state = BegunCall::State::sent;
  sent_.splice(sent_.end(), waiting_, waiting);
}

void BegunCalls::markReturned(Place sent) noexcept {
  sent->state = BegunCall::State::waiting;
  waiting_.splice(waiting_.begin(), sent_, sent);
}

void BegunCalls::finish(BegunCall& call, std::int32_t code, int systemError) noexcept {
  call.result.code = code;
  call.result.system_error = systemError;
  call.message = std::vector<std::byte>();  // {} would keep the memory
  call.regions = {};
  finished_.splice(finished_.end(), listOf(call), call.place);
  call.state = BegunCall::State::finished;
}

}  // namespace brenvik::client
