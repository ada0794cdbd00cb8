// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any bytes of a bus behind the switch of the radio manager's logs: the authentication and messages, whole,
// changed or missing. Every switch must come to its end. The bus is a thread, since sd-bus waits for it.
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>

#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/radio/linux/ModemManagerLogs.h"
#include "platform/runloop/fakes/ManualRunLoop.h"

namespace {

using namespace brenvik;

// In memory where there is such a place, and gone with the process.
struct Folder {
  std::string path = ::access("/dev/shm", W_OK) == 0 ? "/dev/shm/bus-XXXXXX" : "/tmp/bus-XXXXXX";
  Folder() { require(::mkdtemp(path.data()) != nullptr); }
  ~Folder() { std::filesystem::remove_all(path); }
};

// Says to each client what was set, hears it to its end, and waits for the next.
class Bus {
 public:
  explicit Bus(const std::string& path) : listening_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    require(::bind(listening_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
            ::listen(listening_.get(), 4) == 0);
    std::thread([this] { serve(); }).detach();
  }
  void say(std::string answers) {
    const std::lock_guard lock(mutex_);
    answers_ = std::move(answers);
  }

 private:
  void serve() {
    for (;;) {
      const UniqueFd client(::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC));
      std::string answers;
      {
        const std::lock_guard lock(mutex_);
        answers = answers_;
      }
      (void)::send(client.get(), answers.data(), answers.size(), MSG_NOSIGNAL);
      (void)::shutdown(client.get(), SHUT_WR);
      std::array<char, 4096> heard;
      while (::recv(client.get(), heard.data(), heard.size(), 0) > 0) {
      }
    }
  }
  const UniqueFd listening_;
  std::mutex mutex_;
  std::string answers_;
};

class Message {
 public:
  enum Type : std::uint8_t { call = 1, reply = 2, error = 3, signal = 4 };

  static std::string make(Type type, std::uint32_t serial, std::uint32_t replySerial, std::string_view text) {
    Message fields;
    fields.number(5, 'u', replySerial);
    fields.text(6, 's', ":1.1");
    if (type == error) fields.text(4, 's', "org.freedesktop.DBus.Error.Failed");
    if (type == call || type == signal) {
      fields.text(1, 'o', "/org/freedesktop/DBus");
      fields.text(2, 's', "org.freedesktop.DBus");
      fields.text(3, 's', "NameAcquired");
    }
    fields.signature(8, "s");
    Message body;
    body.string(text);
    Message whole;
    whole.bytes_ = {'l', static_cast<char>(type), 0, 1};
    whole.put(static_cast<std::uint32_t>(body.bytes_.size()));
    whole.put(serial);
    whole.put(static_cast<std::uint32_t>(fields.bytes_.size()));
    whole.bytes_ += fields.bytes_;
    whole.pad(8);
    return whole.bytes_ + body.bytes_;
  }

 private:
  void pad(std::size_t to) { bytes_.resize((bytes_.size() + to - 1) / to * to); }
  void put(std::uint32_t value) {
    pad(4);
    for (int i = 0; i < 4; ++i) bytes_ += static_cast<char>(value >> (8 * i) & 0xFF);
  }
  void string(std::string_view value) {
    put(static_cast<std::uint32_t>(value.size()));
    bytes_ += value;
    bytes_ += '\0';
  }
  void begin(char code, char type) {
    pad(8);
    bytes_ += {code, 1, type, '\0'};
  }
  void number(char code, char type, std::uint32_t value) {
    begin(code, type);
    put(value);
  }
  void text(char code, char type, std::string_view value) {
    begin(code, type);
    string(value);
  }
  void signature(char code, std::string_view value) {
    begin(code, 'g');
    bytes_ += static_cast<char>(value.size());
    bytes_ += value;
    bytes_ += '\0';
  }
  std::string bytes_;
};

std::string answersOf(FuzzInput& input) {
  std::string answers;
  const std::uint8_t how = input.byte();
  if ((how & 3) == 3) {
    answers = input.text(2);
  } else {
    answers = "OK 0123456789abcdef0123456789abcdef\r\nAGREE_UNIX_FD\r\n";
    if ((how & 0x0C) != 0x0C) answers += Message::make(Message::reply, 1, 1, ":1.7");
    for (std::size_t count = input.below(4); count > 0; --count) {
      const std::uint8_t what = input.byte();
      answers += Message::make(static_cast<Message::Type>(1 + what % 4), 1 + (what >> 2 & 3U), what >> 4 & 3U,
                               input.text());
    }
  }
  for (std::size_t changes = input.below(6); changes > 0 && !answers.empty(); --changes) {
    const std::size_t at = input.number(2) % answers.size();
    if (input.byte() % 8 == 7) {
      answers.resize(at);
    } else {
      answers[at] = static_cast<char>(input.byte());
    }
  }
  return answers;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const Folder folder;
  static auto& bus = *new Bus(folder.path + "/bus");  // its thread lives until the end
  FuzzInput input(data, size);
  ManualClock clock;
  ManualWorkQueues queues(clock);
  // The end of what the bus says comes first.
  ModemManagerLogs logs(queues, "unix:path=" + folder.path + "/bus", std::chrono::minutes(1));
  for (int i = 0; i < 2; ++i) {
    bus.say(answersOf(input));
    logs.setLogToFile(input.flag());
    for (const auto& queue : queues.serial) queue->runReady();
  }
  return 0;
}
