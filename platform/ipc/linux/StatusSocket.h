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

// A socket beside the service's, at which whoever may connect to the service is told one text: each
// connection gets one datagram and is closed. A connection is no client and holds nothing: it is over before
// the loop goes on, whether its maker reads or not. What an account may ask in a while is limited; beyond
// that its connections are closed without a word, and accepting pauses for a moment. Main loop only.
class StatusSocket {
 public:
  using Now = std::function<RefusalLimit::Time()>;

  // Listens at `servicePath` and kStatusSocketSuffix, mode 0660, with the service socket's group; a socket
  // file that stands there is replaced. `answer` makes the text; it may throw std::bad_alloc. Null, and a
  // line says why, when that cannot be done. What is given outlives the result.
  static std::unique_ptr<StatusSocket> make(SystemPortSpace& ports, RunLoop& loop,
                                            const std::string& servicePath,
                                            std::function<std::string()> answer,
                                            Now now = std::chrono::steady_clock::now);
  // Removes the file, if it is still this socket's.
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
  unsigned long long inode_ = 0;  // of the file; 0: there is none of ours
  SystemPortSpace::SharedFd listening_;
  std::unique_ptr<DescriptorSource> source_;
  std::unique_ptr<LoopSource> tick_;  // while accepting pauses
};

}  // namespace brenvik
