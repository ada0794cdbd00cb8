// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/ipc/linux/RefusalLimit.h"
#include "platform/ipc/linux/SystemPortSpace.h"
#include "platform/runloop/RunLoop.h"

namespace brenvik {

// A socket beside the service's, open to everyone who may connect to the service. Each connection gets one
// text in one datagram and is closed at once, whether the peer reads or not; it is not a client and keeps
// nothing alive. Each account's rate is limited; connections beyond it are closed without an answer, and
// accepting pauses for a moment. Main loop only.
class StatusSocket {
 public:
  using Now = std::function<RefusalLimit::Time()>;

  // Listens at `servicePath` plus kStatusSocketSuffix, mode 0660, with the service socket's group; replaces a
  // socket file that is already there. `answer` makes the text; it may throw std::bad_alloc. Returns null and
  // logs the reason if the socket cannot be made. The arguments must outlive the result.
  static std::unique_ptr<StatusSocket> make(SystemPortSpace& ports, RunLoop& loop,
                                            const std::string& servicePath,
                                            std::function<std::string()> answer,
                                            Now now = std::chrono::steady_clock::now);
  // Removes the socket file if it still belongs to this socket.
  ~StatusSocket();
  StatusSocket(const StatusSocket&) = delete;
  StatusSocket& operator=(const StatusSocket&) = delete;

  int descriptor() const noexcept { return listening_->get(); }

 private:
  StatusSocket(SystemPortSpace& ports, RunLoop& loop, std::string path, std::function<std::string()> answer,
               Now now);
  bool listen(const std::string& servicePath);
  void acceptReady();
  bool acceptOne();
  bool tell(UniqueFd connection);
  void pause();

  SystemPortSpace& ports_;
  RunLoop& loop_;
  const std::string path_;
  const std::function<std::string()> answer_;
  const Now now_;
  RefusalLimit limit_;
  unsigned long long inode_ = 0;  // of the socket file; 0: we have made none
  SystemPortSpace::SharedFd listening_;
  std::unique_ptr<DescriptorSource> source_;
  std::unique_ptr<LoopSource> tick_;  // while accepting pauses
};

}  // namespace brenvik
