// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/fakes/ScriptedHelper.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <stdexcept>
#include <system_error>

namespace brenvik::client {
namespace {

constexpr int kPatience = 60'000;  // milliseconds; only a broken client makes a script wait so long
constexpr std::size_t kMaxDescriptors = 16;

[[noreturn]] void fail(const char* what) { throw std::system_error(errno, std::generic_category(), what); }

UniqueFd checked(int descriptor, const char* what) {
  if (descriptor < 0) fail(what);
  return UniqueFd(descriptor);
}

void awaitInput(int descriptor, const char* what) {
  pollfd entry{descriptor, POLLIN, 0};
  int ready = 0;
  do ready = ::poll(&entry, 1, kPatience);
  while (ready < 0 && errno == EINTR);
  if (ready < 1) throw std::runtime_error(std::string("nothing came: ") + what);
}

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) throw std::length_error(path);
  std::memcpy(address.sun_path, path.data(), path.size());
  return address;
}

}  // namespace

Bytes& Bytes::put(std::size_t offset, const void* value, std::size_t size) {
  if (offset + size > data_.size()) throw std::out_of_range("Bytes");
  std::memcpy(data_.data() + offset, value, size);
  return *this;
}

std::uint32_t Bytes::u32At(std::size_t offset) const {
  std::uint32_t value = 0;
  if (offset + sizeof value > data_.size()) throw std::out_of_range("Bytes");
  std::memcpy(&value, data_.data() + offset, sizeof value);
  return value;
}

std::uint64_t Bytes::u64At(std::size_t offset) const {
  return u32At(offset) | std::uint64_t{u32At(offset + 4)} << 32;
}

Bytes statusReply(const Message& request, std::int32_t code) {
  return Bytes(36)
      .u32(0, 18)
      .u32(4, 36)
      .u32(12, request.replyPort())
      .i32(20, request.id() + 100)
      .ndr(24)
      .i32(32, code);
}

Bytes withResult(Bytes status, std::string_view result) {
  status.append(result);
  status.u32(4, static_cast<std::uint32_t>(status.size()));
  return status;
}

Bytes outOfLineReply(const Message& request, std::uint32_t size, std::uint64_t address) {
  return Bytes(56)
      .u32(0, 0x80000012)
      .u32(4, 56)
      .u32(12, request.replyPort())
      .i32(20, request.id() + 100)
      .u32(24, 1)
      .u64(28, address)
      .u8(36, 1)
      .u8(37, 1)
      .u8(39, 1)
      .u32(40, size)
      .ndr(44)
      .u32(52, size);
}

Bytes inLineReply(const Message& request, std::string_view region) {
  return outOfLineReply(request, static_cast<std::uint32_t>(region.size()), region.empty() ? 0 : 56)
      .append(region);
}

Bytes checkInReply(const Message& request) {
  return Bytes(40)
      .u32(0, 0x80000012)
      .u32(4, 40)
      .u32(12, request.replyPort())
      .i32(20, request.id() + 100)
      .u32(24, 1)
      .u8(38, 19);
}

UniqueFd makeMemory(std::string_view content, int seals) {
  UniqueFd memory = checked(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING), "memfd_create");
  if (::write(memory.get(), content.data(), content.size()) != static_cast<ssize_t>(content.size()))
    fail("write");
  if (seals != 0 && ::fcntl(memory.get(), F_ADD_SEALS, seals) != 0) fail("F_ADD_SEALS");
  return memory;
}

UniqueFd Script::accept() {
  awaitInput(listening_, "a connection");
  return checked(::accept4(listening_, nullptr, nullptr, SOCK_CLOEXEC), "accept4");
}

Message Script::receive(const UniqueFd& channel) {
  awaitInput(channel.get(), "a message");
  std::string data(70'000, '\0');
  alignas(cmsghdr) char control[CMSG_SPACE(kMaxDescriptors * sizeof(int))];
  iovec part{data.data(), data.size()};
  msghdr header{};
  header.msg_iov = &part;
  header.msg_iovlen = 1;
  header.msg_control = control;
  header.msg_controllen = sizeof control;
  const ssize_t length = ::recvmsg(channel.get(), &header, MSG_CMSG_CLOEXEC);
  if (length < 0) fail("recvmsg");
  if (length == 0) throw std::runtime_error("the client closed the channel");
  data.resize(static_cast<std::size_t>(length));
  Message message{Bytes(std::move(data)), {}};
  for (cmsghdr* each = CMSG_FIRSTHDR(&header); each != nullptr; each = CMSG_NXTHDR(&header, each)) {
    if (each->cmsg_level != SOL_SOCKET || each->cmsg_type != SCM_RIGHTS) continue;
    for (std::size_t at = 0; at + sizeof(int) <= each->cmsg_len - CMSG_LEN(0); at += sizeof(int)) {
      int number = -1;
      std::memcpy(&number, CMSG_DATA(each) + at, sizeof number);
      message.descriptors.emplace_back(number);
    }
  }
  return message;
}

void Script::expectEnd(const UniqueFd& channel) {
  awaitInput(channel.get(), "the end of the channel");
  char byte = 0;
  if (::recv(channel.get(), &byte, sizeof byte, MSG_DONTWAIT) > 0) throw std::runtime_error("a message came");
}

bool Script::send(const UniqueFd& channel, const Bytes& bytes, const std::vector<int>& descriptors) {
  alignas(cmsghdr) char control[CMSG_SPACE(kMaxDescriptors * sizeof(int))] = {};
  iovec part{const_cast<char*>(bytes.string().data()), bytes.size()};
  msghdr header{};
  header.msg_iov = &part;
  header.msg_iovlen = 1;
  if (!descriptors.empty()) {
    const std::size_t size = descriptors.size() * sizeof(int);
    header.msg_control = control;
    header.msg_controllen = CMSG_SPACE(size);
    cmsghdr* rights = CMSG_FIRSTHDR(&header);
    rights->cmsg_level = SOL_SOCKET;
    rights->cmsg_type = SCM_RIGHTS;
    rights->cmsg_len = CMSG_LEN(size);
    std::memcpy(CMSG_DATA(rights), descriptors.data(), size);
  }
  if (::sendmsg(channel.get(), &header, MSG_NOSIGNAL) >= 0) return true;
  if (errno != EPIPE && errno != ECONNRESET) fail("sendmsg");
  return false;
}

UniqueFd Script::checkIn() {
  const UniqueFd connection = accept();
  Message request = receive(connection);
  if (request.descriptors.size() != 1) throw std::runtime_error("a check-in carries one descriptor");
  deathWatch_ = std::move(request.descriptors[0]);
  int ends[2];
  if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) fail("socketpair");
  UniqueFd ours(ends[0]);
  const UniqueFd theirs(ends[1]);
  send(connection, checkInReply(request), {theirs.get()});
  return ours;
}

ScriptedHelper::ScriptedHelper(std::function<void(Script&)> script) {
  std::string pattern = (std::filesystem::temp_directory_path() / "scripted-helper-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) fail("mkdtemp");
  directory_ = pattern;
  path_ = directory_ + "/socket";
  listening_ = checked(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0), "socket");
  const sockaddr_un address = addressOf(path_);
  if (::bind(listening_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
    fail("bind");
  if (::listen(listening_.get(), 8) != 0) fail("listen");
  thread_ = std::thread([this, script = std::move(script)] {
    try {
      Script run;
      run.listening_ = listening_.get();
      script(run);
    } catch (const std::exception& error) {
      failure_ = error.what();
    }
  });
}

void ScriptedHelper::finish() {
  if (thread_.joinable()) thread_.join();
  if (!failure_.empty()) ADD_FAILURE() << "the script stopped: " << failure_;
  failure_.clear();
}

ScriptedHelper::~ScriptedHelper() {
  finish();
  std::error_code ignored;
  std::filesystem::remove_all(directory_, ignored);
}

TemporaryDirectory::TemporaryDirectory() {
  std::string pattern = (std::filesystem::temp_directory_path() / "client-test-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) fail("mkdtemp");
  path_ = pattern;
}

TemporaryDirectory::~TemporaryDirectory() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

UniqueFd connectTo(const std::string& path) {
  UniqueFd socket = checked(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0), "socket");
  const sockaddr_un address = addressOf(path);
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
    fail("connect");
  return socket;
}

std::size_t openDescriptors() {
  std::size_t count = 0;
  for ([[maybe_unused]] const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) ++count;
  return count;
}

}  // namespace brenvik::client
