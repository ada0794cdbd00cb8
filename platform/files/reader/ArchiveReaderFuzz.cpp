// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Archives through the reader, and its frames through the parser that the helper takes them apart with. The
// input describes an archive, with lies wherever the format repeats itself, and changes of its bytes; or it
// is the archive.
#include <unistd.h>

#include <algorithm>
#include <array>
#include <clocale>
#include <string>
#include <string_view>

#include "ArchiveReading.h"
#include "platform/base/UniqueFd.h"
#include "platform/base/fakes/FuzzInput.h"
#include "platform/files/archive/ResourceCompanion.h"
#include "platform/files/fakes/CheckingFrameSink.h"
#include "platform/files/fakes/ZipBuilder.h"

#include <sys/mman.h>

namespace {

using namespace brenvik;

// Takes the companion's bytes apart, too.
class CompanionSink final : public ArchiveFrameSink {
 public:
  int beginEntry(const ArchiveEntry& entry) override {
    companion_.clear();
    return checking_.beginEntry(entry);
  }
  int entryData(std::string_view bytes) override { return checking_.entryData(bytes); }
  int entryCompanion(std::string_view bytes) override {
    companion_ += bytes;
    return checking_.entryCompanion(bytes);
  }
  int endEntry() override {
    for (const auto& [name, value] : extendedAttributesOf(companion_))
      require(!name.empty() && value.size() <= companion_.size());
    return checking_.endEntry();
  }
  int refuseEntry(const std::string& path, int code) override { return checking_.refuseEntry(path, code); }

 private:
  CheckingFrameSink checking_;
  std::string companion_;
};

// The parser at the other end of the pipe. What the reader says is always well-formed, and a failure that it
// reports is the last that it says.
class ParsedFrames final : public FrameOutput {
 public:
  void frame(archive_frame::Type type, const void* bytes, std::size_t length) override {
    require(!hasFailed && !parser_.hasFinished());
    const archive_frame::Head head{type, static_cast<std::uint32_t>(length)};
    take({reinterpret_cast<const char*>(&head), sizeof head});
    take({static_cast<const char*>(bytes), length});
  }
  void flush() override {}
  bool hasFinished() const { return parser_.hasFinished(); }
  bool hasFailed = false;

 private:
  void take(std::string_view bytes) {
    if (bytes.empty() || hasFailed) return;
    const int code = parser_.take(bytes);
    require(code != EPROTO);
    hasFailed = code != 0;
  }
  CompanionSink sink_;
  ArchiveFrameParser parser_{sink_};
};

std::string name(FuzzInput& input) {
  static constexpr std::array kNames{"a",    "b/c",  "dir/",  "../x",      "/etc/x",       "a/../b",
                                     "a//b", "a\\b", "._a",   "__MACOSX/", "__MACOSX/._a", "\xC3\xA9",
                                     "\xFF", ".",    "a/b/c", "a/./b"};
  const std::size_t which = input.below(kNames.size() + 2);
  return which < kNames.size() ? kNames[which] : std::string(input.text(2));
}

std::string archive(FuzzInput& input) {
  const std::uint8_t kind = input.byte();
  if (kind % 4 == 3) {
    const auto bytes = input.rest();
    return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
  }
  ZipBuilder zip;
  for (std::size_t count = input.below(6); count > 0; --count) {
    const std::uint8_t how = input.byte();
    static constexpr std::array<std::uint32_t, 8> kModes{0100644, 0100755, 040755, 0120777,
                                                         0104755, 060644,  010644, 0};
    ZipBuilder::Entry entry{
        .name = name(input), .content = std::string(input.text()), .mode = kModes[how & 7U]};
    if ((how & 8) != 0) entry.flags = static_cast<std::uint16_t>(input.number(2));
    entry.isZip64 = (how & 0x10) != 0;
    entry.hasDescriptor = (how & 0x20) != 0;
    entry.sharesData = (how & 0x40) != 0;
    if ((how & 0x80) != 0) {
      const std::uint8_t lies = input.byte();
      if ((lies & 1) != 0) entry.claimedSize = static_cast<std::uint32_t>(input.number(4));
      if ((lies & 2) != 0) entry.claimedChecksum = static_cast<std::uint32_t>(input.number(4));
      if ((lies & 4) != 0) entry.localName = name(input);
    }
    zip.add(std::move(entry));
  }
  std::string bytes = zip.build();
  for (std::size_t changes = input.below(6); changes > 0 && !bytes.empty(); --changes) {
    const std::size_t at = input.number(2) % bytes.size();
    const auto with = input.bytes(1 + input.below(8));
    std::transform(with.begin(),
                   with.begin() + std::min<std::ptrdiff_t>(
                                      std::ssize(with), std::ssize(bytes) - static_cast<std::ptrdiff_t>(at)),
                   bytes.begin() + static_cast<std::ptrdiff_t>(at),
                   [](std::byte byte) { return static_cast<char>(byte); });
  }
  return bytes;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const bool hasLocale = std::setlocale(LC_CTYPE, "C.UTF-8") != nullptr;
  static const UniqueFd file(::memfd_create("archive", MFD_CLOEXEC));
  require(hasLocale && file.isValid());
  FuzzInput input(data, size);
  const std::string bytes = archive(input);
  require(::ftruncate(file.get(), 0) == 0 && ::lseek(file.get(), 0, SEEK_SET) == 0 &&
          ::pwrite(file.get(), bytes.data(), bytes.size(), 0) == static_cast<ssize_t>(bytes.size()));
  ParsedFrames frames;
  const bool isWhole = readArchive(file.get(), frames);
  require(isWhole ? frames.hasFinished() : frames.hasFailed);
  return 0;
}
