// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/servicemanager/linux/NotifySocket.h"

#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/base/UniqueFd.h"

namespace brenvik {

NotifySocket::NotifySocket() noexcept {
  const char* const name = std::getenv(kVariable);
  const std::size_t length = name != nullptr ? std::strlen(name) : 0;
  if (length > 1 && length < sizeof address_.sun_path && (*name == '/' || *name == '@')) {
    address_.sun_family = AF_UNIX;
    std::memcpy(address_.sun_path, name, length);
    // The bytes of an abstract name are counted; a path ends with its NUL.
    const bool isAbstract = *name == '@';
    if (isAbstract) address_.sun_path[0] = '\0';
    size_ = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length + (isAbstract ? 0 : 1));
  }
  ::unsetenv(kVariable);
}

void NotifySocket::show(const std::string& line) {
  if (!listens()) return;
  std::string message = "STATUS=" + line;
  for (char& c : message) {
    if (c == '\n') c = ' ';  // the next line would be another variable
  }
  const UniqueFd socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  (void)::sendto(socket.get(), message.data(), message.size(), MSG_DONTWAIT | MSG_NOSIGNAL,
                 reinterpret_cast<const sockaddr*>(&address_),
                 size_);  // it is for people, and the next one comes
}

}  // namespace brenvik
