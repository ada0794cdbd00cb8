// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/fakes/ScriptedHelper.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <stdexcept>
#include <system_error>

#include "platform/datagram/Datagram.h"
#include "platform/datagram/Deadline.h"
#include "platform/datagram/LocalSocket.h"
#include "platform/datagram/SealedMemory.h"

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
  if (waitFor(descriptor, POLLIN, Deadline::in(std::chrono::milliseconds(kPatience))) != 0)
    throw std::runtime_error(std::string("nothing came: ") + what);
}

sockaddr_un addressOf(const std::string& path) {
  const auto address = socketAddress(path);
  if (!address) throw std::length_error(path);
  return *address;
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
  UniqueFd memory = checked(makeSealableMemory("test").release(), "memfd_create");
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
  const iovec room{data.data(), data.size()};
  ControlRoom<kMaxDescriptors> control;
  std::vector<UniqueFd> descriptors(kMaxDescriptors);
  ReceivedDatagram received;
  errno = receiveDatagram(channel.get(), std::span(&room, 1), control.bytes, descriptors, 0, &received);
  if (errno != 0) fail("recvmsg");
  if (received.length == 0) throw std::runtime_error("the client closed the channel");
  data.resize(received.length);
  descriptors.resize(received.descriptorCount);
  Message message{Bytes(std::move(data)), std::move(descriptors)};
  return message;
}

void Script::expectEnd(const UniqueFd& channel) {
  awaitInput(channel.get(), "the end of the channel");
  char byte = 0;
  if (::recv(channel.get(), &byte, sizeof byte, MSG_DONTWAIT) > 0) throw std::runtime_error("a message came");
}

bool Script::send(const UniqueFd& channel, const Bytes& bytes, const std::vector<int>& descriptors) {
  const std::array parts{iovecOf(std::as_bytes(std::span(bytes.string())))};
  // A script may fill the channel: it waits for room as a blocking send would.
  while ((errno = sendDatagram(channel.get(), parts, descriptors)) == EAGAIN) {
    if (waitFor(channel.get(), POLLOUT, Deadline::in(std::chrono::milliseconds(kPatience))) != 0)
      fail("sendmsg");
  }
  if (errno == 0) return true;
  if (errno != EPIPE && errno != ECONNRESET) fail("sendmsg");
  return false;
}

UniqueFd Script::checkIn() {
  const UniqueFd connection = accept();
  Message request = receive(connection);
  if (request.descriptors.size() != 1) throw std::runtime_error("a check-in carries one descriptor");
  deathWatch_ = std::move(request.descriptors[0]);
  UniqueFd ours;
  UniqueFd theirs;
  if ((errno = makeSocketPair(&ours, &theirs)) != 0) fail("socketpair");
  send(connection, checkInReply(request), {theirs.get()});
  return ours;
}

ScriptedHelper::ScriptedHelper(std::function<void(Script&)> script) {
  std::string pattern = (std::filesystem::temp_directory_path() / "scripted-helper-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) fail("mkdtemp");
  directory_ = pattern;
  path_ = directory_ + "/socket";
  listening_ = checked(makeSocket(Blocking::yes).release(), "socket");
  if (bindSocket(listening_.get(), addressOf(path_)) != 0) fail("bind");
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
  UniqueFd socket = checked(makeSocket(Blocking::yes).release(), "socket");
  if (connectSocket(socket.get(), addressOf(path)) != 0) fail("connect");
  return socket;
}

std::size_t openDescriptors() {
  std::size_t count = 0;
  for ([[maybe_unused]] const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) ++count;
  return count;
}

}  // namespace brenvik::client
