// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Any requests, over a real channel, to the store worker's side, with a real folder. The first byte is the
// sort of work and says whether the folder comes along with the first and with each message; each message
// begins with its length, two bytes.
#include <fcntl.h>

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <utility>

#include "workers/stores/StoreService.h"

namespace {

using namespace brenvik;

void require(bool condition) {
  if (!condition) std::abort();
}

// In memory where there is such a place, and gone with the process.
struct Folder {
  std::string path = ::access("/dev/shm", W_OK) == 0 ? "/dev/shm/fuzz-XXXXXX" : "/tmp/fuzz-XXXXXX";
  Folder() { require(::mkdtemp(path.data()) != nullptr); }
  ~Folder() { std::filesystem::remove_all(path); }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const Folder folder;
  if (size == 0) return 0;
  const std::uint8_t how = *data++;
  --size;
  WorkerChannel ours;
  WorkerChannel theirs;
  require(WorkerChannel::makePair(&ours, &theirs) == WorkerResult::done);
  for (int i = 0; i < 16 && size >= 6; ++i) {
    const std::size_t length = std::min<std::size_t>(data[0] + 256U * data[1], size - 6);
    WorkerMessage message;
    message.kind = data[2] | static_cast<std::uint32_t>(data[3]) << 8 |
                   static_cast<std::uint32_t>(data[4]) << 16 | static_cast<std::uint32_t>(data[5]) << 24;
    const auto* const bytes = reinterpret_cast<const std::byte*>(data) + 6;
    message.payload.assign(bytes, bytes + std::min(length, WorkerMessage::kLongestPayload));
    if ((how & 8) != 0 || ((how & 4) != 0 && i == 0))
      message.descriptors.emplace_back(::open(folder.path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (ours.send(message) != WorkerResult::done) break;
    data += 6 + length;
    size -= 6 + length;
  }
  ours.close();  // what was sent is read, then the end of it
  serveStore(how & 3U, std::move(theirs));
  return 0;
}
