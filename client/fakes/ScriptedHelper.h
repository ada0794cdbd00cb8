// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/base/UniqueFd.h"

// A helper for tests that does exactly what its script says, lies included. It knows the wire only: its
// messages are put together byte by byte, not from the structs that the client uses.
namespace brenvik::client {

// A message as bytes, written and read at offsets, little-endian.
class Bytes {
 public:
  Bytes() = default;
  explicit Bytes(std::size_t size) : data_(size, '\0') {}
  explicit Bytes(std::string data) : data_(std::move(data)) {}

  Bytes& u8(std::size_t offset, std::uint8_t value) { return put(offset, &value, sizeof value); }
  Bytes& u32(std::size_t offset, std::uint32_t value) { return put(offset, &value, sizeof value); }
  Bytes& i32(std::size_t offset, std::int32_t value) { return put(offset, &value, sizeof value); }
  Bytes& u64(std::size_t offset, std::uint64_t value) { return put(offset, &value, sizeof value); }
  Bytes& f64(std::size_t offset, double value) { return put(offset, &value, sizeof value); }
  Bytes& text(std::size_t offset, std::string_view value) { return put(offset, value.data(), value.size()); }
  Bytes& ndr(std::size_t offset) { return u8(offset + 4, 1); }
  Bytes& append(std::string_view bytes) {
    data_ += bytes;
    return *this;
  }

  std::uint8_t u8At(std::size_t offset) const { return static_cast<std::uint8_t>(data_.at(offset)); }
  std::uint32_t u32At(std::size_t offset) const;
  std::int32_t i32At(std::size_t offset) const { return static_cast<std::int32_t>(u32At(offset)); }
  std::uint64_t u64At(std::size_t offset) const;

  std::size_t size() const { return data_.size(); }
  const std::string& string() const { return data_; }
  bool operator==(const Bytes&) const = default;

 private:
  Bytes& put(std::size_t offset, const void* value, std::size_t size);
  std::string data_;
};

struct Message {
  Bytes bytes;
  std::vector<UniqueFd> descriptors;

  std::uint32_t replyPort() const { return bytes.u32At(8); }
  std::int32_t id() const { return bytes.i32At(20); }
};

// Replies, correct ones.
Bytes statusReply(const Message& request, std::int32_t code);
Bytes withResult(Bytes status, std::string_view result);  // status + fields from 36
Bytes outOfLineReply(const Message& request, std::uint32_t size, std::uint64_t address);
Bytes inLineReply(const Message& request, std::string_view region);
Bytes checkInReply(const Message& request);

UniqueFd makeMemory(std::string_view content, int seals);
inline constexpr int kAllSeals = 0x2 | 0x4 | 0x8;  // shrink, grow, write

class Script {
 public:
  // Each waits for at most a minute and throws when what it waits for does not come.
  UniqueFd accept();
  Message receive(const UniqueFd& channel);
  void expectEnd(const UniqueFd& channel);
  // False when the peer has gone.
  bool send(const UniqueFd& channel, const Bytes& bytes, const std::vector<int>& descriptors = {});

  // Accepts, answers the check-in, and returns our end of the new channel. The caller's death-watch port
  // goes to deathWatch().
  UniqueFd checkIn();
  const UniqueFd& deathWatch() const { return deathWatch_; }

 private:
  friend class ScriptedHelper;
  int listening_ = -1;
  UniqueFd deathWatch_;
};

// Listens at path(), in a folder of its own, and runs the script on a thread.
class ScriptedHelper {
 public:
  explicit ScriptedHelper(std::function<void(Script&)> script);
  ScriptedHelper(const ScriptedHelper&) = delete;
  ScriptedHelper& operator=(const ScriptedHelper&) = delete;
  // Waits for the script's end and fails the test when it threw.
  ~ScriptedHelper();
  const std::string& path() const { return path_; }
  const std::string& directory() const { return directory_; }
  void finish();

 private:
  std::string directory_;
  std::string path_;
  UniqueFd listening_;
  std::string failure_;
  std::thread thread_;
};

// A folder under /tmp that is removed, with the files in it, when the object goes.
class TemporaryDirectory {
 public:
  TemporaryDirectory();
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
  ~TemporaryDirectory();
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

// A connection to a socket of type SOCK_SEQPACKET; throws when nobody listens.
UniqueFd connectTo(const std::string& path);

std::size_t openDescriptors();

}  // namespace brenvik::client
