// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/Routes.h"

#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <netinet/in.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdlib>

namespace brenvik {
namespace {

// From now on this process cannot send, and receiving ends it with SIGSYS.
bool forbidSending() {
  constexpr auto refuse = static_cast<std::uint32_t>(SECCOMP_RET_ERRNO | ENOBUFS);
  constexpr auto end = static_cast<std::uint32_t>(SECCOMP_RET_KILL_PROCESS);
  std::array filter{
      sock_filter BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      sock_filter BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_sendto, 2, 0),
      sock_filter BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_recvfrom, 2, 0),
      sock_filter BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
      sock_filter BPF_STMT(BPF_RET | BPF_K, refuse),
      sock_filter BPF_STMT(BPF_RET | BPF_K, end),
  };
  const sock_fprog program{filter.size(), filter.data()};
  return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

TEST(RoutesTest, ForAQuestionThatCannotBeSentNoAnswerIsAwaited) {
  EXPECT_EXIT(
      {
        if (!forbidSending()) std::_Exit(3);
        sockaddr_in peer{};
        peer.sin_family = AF_INET;
        peer.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        if (interfaceTo(reinterpret_cast<const sockaddr&>(peer))) std::_Exit(1);
        std::_Exit(interfacesWithRoutes() ? 2 : 0);
      },
      testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace brenvik
