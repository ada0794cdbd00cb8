// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/security/linux/CallerFacts.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <array>

#include "platform/worker/WorkerFields.h"

namespace brenvik {

std::optional<FileIdentity> identityAt(int folder, const char* path) noexcept {
  struct statx facts {};
  if (::statx(folder, path, AT_STATX_DONT_SYNC, STATX_INO, &facts) != 0) return std::nullopt;
  return FileIdentity{::makedev(facts.stx_dev_major, facts.stx_dev_minor), facts.stx_ino};
}

CallerFacts callerFactsOf(int folder) {
  CallerFacts facts;
  std::array<char, PATH_MAX> path;
  const ssize_t size = ::readlinkat(folder, "exe", path.data(), path.size());
  if (size > 0) facts.executablePath.assign(path.data(), static_cast<std::size_t>(size));
  facts.executable = identityAt(folder, "exe");
  facts.userNamespace = identityAt(folder, "ns/user");
  return facts;
}

namespace callers {
namespace {

void write(FieldWriter& to, const FileIdentity& identity) { to.u64(identity.device).u64(identity.inode); }

FileIdentity read(FieldReader& from) noexcept {
  const std::uint64_t device = from.u64();
  return {device, from.u64()};
}

}  // namespace

bool isQuestion(const WorkerMessage& message) noexcept {
  return message.kind == kFacts && message.payload.empty() && message.descriptors.size() == 1;
}

WorkerMessage encode(const CallerFacts& facts) {
  WorkerMessage message;
  message.kind = kFacts;
  message.payload = FieldWriter()
                        .optional(facts.executable, write)
                        .text(facts.executablePath)
                        .optional(facts.userNamespace, write)
                        .take();
  return message;
}

std::optional<CallerFacts> decode(const WorkerMessage& message) {
  if (message.kind != kFacts || !message.descriptors.empty()) return std::nullopt;
  FieldReader from(message.payload);
  CallerFacts facts;
  facts.executable = from.optional(read);
  const std::string_view path = from.text();
  facts.userNamespace = from.optional(read);
  if (!from.whole() || path.size() > PATH_MAX) return std::nullopt;
  facts.executablePath = path;
  return facts;
}

}  // namespace callers
}  // namespace brenvik
