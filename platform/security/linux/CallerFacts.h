// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>

#include "platform/worker/WorkerMessage.h"

namespace brenvik {

struct FileIdentity {
  dev_t device;
  ino_t inode;
  bool operator==(const FileIdentity&) const = default;
};

// The file that a path below an open folder leads to. Asks no file server: what the kernel remembers is
// enough, and somebody's own file system cannot make the caller wait. Returns nothing and sets errno on
// failure.
std::optional<FileIdentity> identityAt(int folder, const char* path) noexcept;

// What only a process with CAP_SYS_PTRACE can read of another account's process.
struct CallerFacts {
  // The file that it executes now; nothing if it has exited, even if it is still a zombie.
  std::optional<FileIdentity> executable;
  std::string executablePath;  // according to the kernel; empty if unknown
  std::optional<FileIdentity> userNamespace;
};

// `folder` is the process's open folder in /proc, and may be O_PATH. If something could not be read, errno
// says why. Throws std::bad_alloc.
CallerFacts callerFactsOf(int folder);

// The protocol between the helper and the caller worker. One channel serves any number of questions, and
// others wait until it closes. A question is the process's folder in /proc, as a descriptor; the answer
// follows before the next question. Encoding and decoding throw std::bad_alloc; decoding returns nothing for
// a malformed message.
namespace callers {

inline constexpr const char* kService = "com.norvale.brenvik.mobile-helper.callers";
inline constexpr const char* kProgram = "brenvik-caller-worker";
// The kind of the only channels, of a question, and of an answer.
inline constexpr std::uint32_t kFacts = 1;

bool isQuestion(const WorkerMessage& message) noexcept;
WorkerMessage encode(const CallerFacts& facts);
std::optional<CallerFacts> decode(const WorkerMessage& message);

}  // namespace callers
}  // namespace brenvik
