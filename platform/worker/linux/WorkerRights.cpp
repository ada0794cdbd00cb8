// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/worker/linux/WorkerRights.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/audit.h>
#include <linux/capability.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <pwd.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <new>
#include <optional>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

struct Ids {
  uid_t uid;
  gid_t gid;
};

// Looked up while this process has no other thread.
std::optional<Ids> accountFor(const WorkerRights& rights) {
  for (const std::string& name : rights.accounts) {
    if (const passwd* const entry = ::getpwnam(name.c_str()); entry != nullptr)
      return Ids{entry->pw_uid, entry->pw_gid};
  }
  if (rights.otherwise == static_cast<uid_t>(-1)) return std::nullopt;
  return Ids{rights.otherwise, rights.otherwise};
}

bool setCapabilities(const std::vector<int>& kept) noexcept {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3] = {};
  for (const int capability : kept) {
    const unsigned bit = 1U << (static_cast<unsigned>(capability) % 32);
    data[capability / 32].permitted |= bit;
    data[capability / 32].effective |= bit;
  }
  return ::syscall(SYS_capset, &header, data) == 0;
}

bool hasOnly(const std::vector<int>& kept) noexcept {
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3] = {};
  if (::syscall(SYS_capget, &header, data) != 0) return false;
  for (const int capability : kept)
    data[capability / 32].permitted &= ~(1U << (static_cast<unsigned>(capability) % 32));
  return data[0].permitted == 0 && data[1].permitted == 0 && data[0].inheritable == 0 &&
         data[1].inheritable == 0;
}

// Whether root is the only account of this process's user namespace: then it is everybody's.
bool isOnlyAccount() noexcept {
  const UniqueFd map(::open("/proc/self/uid_map", O_RDONLY | O_CLOEXEC));
  char text[128];
  const ssize_t length = map.isValid() ? ::read(map.get(), text, sizeof text - 1) : 0;
  if (length <= 0) return false;
  text[length] = '\0';
  unsigned long first = 0;
  unsigned long count = 0;
  return std::strchr(text, '\n') == text + length - 1 &&
         std::sscanf(text, "%lu %*u %lu", &first, &count) == 2 && first == 0 && count == 1;
}

// Whether the numbers exist in this process's user namespace: the kernel refuses the others as invalid.
enum class Became { account, onlyAccount, nothing };
Became become(const Ids& ids) noexcept {
  const bool hasNoGroups = ::setgroups(0, nullptr) == 0;
  const bool isOfGroup = ::setresgid(ids.gid, ids.gid, ids.gid) == 0;
  if (::setresuid(ids.uid, ids.uid, ids.uid) != 0)
    return errno == EINVAL ? Became::onlyAccount : Became::nothing;
  return hasNoGroups && isOfGroup ? Became::account : Became::nothing;
}

bool isOrdinaryForGood() noexcept {
  uid_t uids[3];
  gid_t gids[3];
  if (::getresuid(&uids[0], &uids[1], &uids[2]) != 0 || ::getresgid(&gids[0], &gids[1], &gids[2]) != 0)
    return false;
  for (const uid_t uid : uids) {
    if (uid == 0) return false;
  }
  for (const gid_t gid : gids) {
    if (gid == 0) return false;
  }
  return ::setresuid(0, 0, 0) != 0 && ::setresgid(0, 0, 0) != 0;
}

bool limit(__rlimit_resource what, rlim_t value) noexcept {
  const rlimit both{value, value};
  return ::setrlimit(what, &both) == 0;
}

#if defined(__x86_64__)
constexpr std::uint32_t kArchitecture = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr std::uint32_t kArchitecture = AUDIT_ARCH_AARCH64;
#else
constexpr std::uint32_t kArchitecture = 0;
#endif

constexpr std::uint32_t kAnd = SECCOMP_RET_ERRNO;

// By hand, for a dozen calls. After it the number of the call is loaded.
std::vector<sock_filter> beginningOfFilter() {
  constexpr std::uint32_t kOtherTable = 0x40000000;  // a second numbering of x86-64's calls
  return {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, kArchitecture, 1, 0),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS),
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      BPF_JUMP(BPF_JMP | BPF_JGE | BPF_K, kOtherTable, 0, 1),
      BPF_STMT(BPF_RET | BPF_K, kAnd | EPERM),
  };
}

void decide(std::vector<sock_filter>* filter, std::uint32_t call, std::uint32_t decision) {
  filter->push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, call, 0, 1));
  filter->push_back(BPF_STMT(BPF_RET | BPF_K, decision));
}

bool install(std::vector<sock_filter> filter) noexcept {
  const sock_fprog program{static_cast<unsigned short>(filter.size()), filter.data()};
  return ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0) == 0;
}

bool refuseAllBut(const std::vector<std::uint32_t>& calls) {
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
  if (kArchitecture == 0) return false;
  std::vector<sock_filter> filter = beginningOfFilter();
  for (const std::uint32_t call : calls) decide(&filter, call, SECCOMP_RET_ALLOW);
  filter.push_back(BPF_STMT(BPF_RET | BPF_K, kAnd | EPERM));
  return install(std::move(filter));
#else
  return !calls.empty();
#endif
}

// Refuses the calls with an error; everything else is as before.
bool refuseForeignCalls() {
  if (kArchitecture == 0) return true;
  constexpr std::uint32_t kRefused[] = {
      SYS_execve,         SYS_execveat,    SYS_ptrace, SYS_process_vm_readv, SYS_process_vm_writev,
      SYS_io_uring_setup, SYS_pidfd_getfd, SYS_bpf,    SYS_userfaultfd,      SYS_mount,
      SYS_unshare,        SYS_setns};
  std::vector<sock_filter> filter = beginningOfFilter();
  for (const std::uint32_t call : kRefused) decide(&filter, call, kAnd | EPERM);
  filter.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_socket, 0, 3));
  filter.push_back(BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, args)));
  filter.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, AF_UNIX, 1, 0));
  filter.push_back(BPF_STMT(BPF_RET | BPF_K, kAnd | EAFNOSUPPORT));
  filter.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
  return install(std::move(filter));
}

// Leaves root's account; null, or in words what went wrong, as giveUpRights(). *kept are the capabilities
// that stay.
const char* leaveRoot(const WorkerRights& rights, std::vector<int>* kept) {
  const std::optional<Ids> ids = accountFor(rights);
  if (!ids) return "the account does not exist";
  const bool isRoots = ids->uid == 0 || ids->gid == 0;
  if (isRoots && !isOnlyAccount()) return "the account is root's";
  if (rights.keptCapabilities) *kept = rights.keptCapabilities(ids->gid);
  // Else they go with the account.
  if (!kept->empty() && ::prctl(PR_SET_KEEPCAPS, 1, 0, 0, 0) != 0) return "no capability can be kept";
  const Became became = isRoots ? Became::onlyAccount : become(*ids);
  if (became == Became::nothing) return "root's account cannot be left";
  if (became == Became::onlyAccount) return nullptr;
  // Before the way back is tried, which they would open.
  if (!setCapabilities(*kept)) return "capabilities cannot be dropped";
  return isOrdinaryForGood() ? nullptr : "root's account can be had again";
}

// Drops all capabilities but these, and bars every way to get others.
const char* keepOnly(const std::vector<int>& kept) noexcept {
  (void)::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0);  // kernels without them have none
  if (!setCapabilities(kept) || !hasOnly(kept)) return "capabilities cannot be dropped";
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) return "new privileges cannot be refused";
  return ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0) == 0 ? nullptr : "other processes can look into it";
}

const char* setLimits(const WorkerRights& rights) noexcept {
  if (!limit(RLIMIT_CORE, 0) || !limit(RLIMIT_NOFILE, rights.descriptors)) return "it cannot be limited";
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
  if (rights.addressSpace != 0 && !limit(RLIMIT_AS, rights.addressSpace))
    return "its memory cannot be limited";
#endif
  return nullptr;
}

}  // namespace

const char* giveUpRights(const WorkerRights& rights) noexcept try {
  std::vector<int> kept;
  if (::geteuid() == 0 || ::getuid() == 0) {
    if (const char* const why = leaveRoot(rights, &kept); why != nullptr) return why;
  } else if (rights.keptCapabilities) {
    // The service manager has said already what it may keep.
    kept = rights.keptCapabilities(::getegid());
    if (!setCapabilities(kept)) kept.clear();
  }
  if (const char* const why = keepOnly(kept); why != nullptr) return why;
  if (const char* const why = setLimits(rights); why != nullptr) return why;
  const bool areRefused = (!rights.isLocalOnly || refuseForeignCalls()) &&
                          (rights.onlyCalls.empty() || refuseAllBut(rights.onlyCalls));
  return areRefused ? nullptr : "system calls cannot be refused";
} catch (const std::bad_alloc&) {
  return "out of memory";
}

}  // namespace brenvik
