// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/servicemanager/linux/NotifySocket.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/base/UniqueFd.h"

namespace brenvik {
namespace {

// Stands where the service manager stands.
class Manager {
 public:
  explicit Manager(const std::string& name) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    name.copy(address.sun_path, sizeof address.sun_path);
    if (name[0] == '@') address.sun_path[0] = '\0';
    const auto size =
        static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size() + (name[0] == '@' ? 0 : 1));
    EXPECT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), size), 0)
        << std::strerror(errno);
    ::setenv("NOTIFY_SOCKET", name.c_str(), 1);
  }
  // Empty when nothing has come.
  std::string told() {
    std::array<char, 1024> text;
    const ssize_t size = ::recv(socket.get(), text.data(), text.size(), MSG_DONTWAIT);
    return size <= 0 ? "" : std::string(text.data(), static_cast<std::size_t>(size));
  }
  const UniqueFd socket{::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)};
};

std::string uniqueName(const std::string& beginning) {
  return beginning + "brenvik-notify-" + std::to_string(::getpid());
}

TEST(NotifySocketTest, ALineGoesToThePathThatIsNamed) {
  const std::string path = uniqueName("/tmp/");
  Manager manager(path);
  NotifySocket socket;
  ASSERT_TRUE(socket.listens());
  EXPECT_EQ(std::getenv("NOTIFY_SOCKET"), nullptr) << "no child is given it";
  socket.show("1 client");
  EXPECT_EQ(manager.told(), "STATUS=1 client");
  ::unlink(path.c_str());
}

TEST(NotifySocketTest, ALineGoesToTheAbstractNameThatIsNamed) {
  Manager manager(uniqueName("@"));
  NotifySocket socket;
  socket.show("idle");
  EXPECT_EQ(manager.told(), "STATUS=idle");
}

TEST(NotifySocketTest, NothingInALineIsTakenForAnotherVariable) {
  Manager manager(uniqueName("@"));
  NotifySocket socket;
  socket.show("a\nREADY=1");
  EXPECT_EQ(manager.told(), "STATUS=a READY=1");
}

TEST(NotifySocketTest, AManagerThatReadsNothingIsNotWaitedFor) {
  Manager manager(uniqueName("@"));
  NotifySocket socket;
  for (int i = 0; i < 2000; ++i) socket.show("line " + std::to_string(i));  // more than any queue has
  EXPECT_EQ(manager.told(), "STATUS=line 0");
}

TEST(NotifySocketTest, WithoutANameNobodyListens) {
  for (const std::string& name : {std::string(), std::string("/"), std::string("relative"),
                                  std::string("vsock:2:9"), "/" + std::string(108, 'x')}) {
    ::setenv("NOTIFY_SOCKET", name.c_str(), 1);
    NotifySocket socket;
    EXPECT_FALSE(socket.listens()) << name;
    socket.show("nobody hears it");
  }
}

}  // namespace
}  // namespace brenvik
