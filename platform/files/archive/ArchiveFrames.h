// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace brenvik {

// The protocol between the archive reader, a process of its own, and the helper: the reader writes frames to
// a pipe, each a header and `length` bytes. Both run on one machine and come from one build, so numbers are
// written as in memory. The reader handles hostile bytes, so the helper checks all that it says.
namespace archive_frame {

enum class Type : std::uint32_t {
  entry = 1,      // EntryHead, path, link target: the next entry begins
  data = 2,       // bytes of the file
  companion = 3,  // bytes of the file's companion: resource data and extended attributes
  endOfEntry = 4,
  end = 5,      // the archive was read to its end
  refused = 6,  // Refusal, path: an entry that the reader refuses
  failed = 7    // Refusal: the rest of the archive cannot be read
};

struct Head {
  Type type;
  std::uint32_t length;
};
static_assert(sizeof(Head) == 8);

enum class Kind : std::uint8_t { file = 0, directory = 1, link = 2 };

struct EntryHead {
  std::uint64_t size;     // of a file's data, as the archive claims; kUnknownSize
  std::int64_t modified;  // seconds since 1970; kNoTime
  std::uint16_t pathLength;
  std::uint16_t targetLength;
  Kind kind;
  std::uint8_t pad;
  std::uint16_t mode;  // permission bits only
};
static_assert(sizeof(EntryHead) == 24);

struct Refusal {
  std::int32_t code;  // errno value
};

inline constexpr std::uint64_t kUnknownSize = ~std::uint64_t{0};
inline constexpr std::int64_t kNoTime = INT64_MIN;
inline constexpr std::size_t kLongestPath = 1024;
inline constexpr int kPipe = 1 << 20;                        // the pipe's capacity, bytes
inline constexpr std::uint32_t kLargeChunk = 64 << 10;       // a chunk of this size is written alone
inline constexpr std::uint32_t kLargestChunk = 1 << 20;      // data or companion bytes in one frame
inline constexpr std::uint32_t kLargestCompanion = 4 << 20;  // companion bytes of one entry

}  // namespace archive_frame

struct ArchiveEntry {
  archive_frame::Kind kind = archive_frame::Kind::file;
  std::uint16_t mode = 0644;  // permission bits; no set-id, no sticky bit. Means nothing for a link
  std::uint64_t size = archive_frame::kUnknownSize;
  std::int64_t modified = archive_frame::kNoTime;
  std::string path;    // as the archive has it, not checked
  std::string target;  // of a link, not checked
};

// Receives the contents of the frames, in order. Each call returns 0 to go on or an errno value to stop.
class ArchiveFrameSink {
 public:
  virtual ~ArchiveFrameSink() = default;
  virtual int beginEntry(const ArchiveEntry& entry) = 0;
  virtual int entryData(std::string_view bytes) = 0;       // between beginEntry and endEntry, of files only
  virtual int entryCompanion(std::string_view bytes) = 0;  // between beginEntry and endEntry
  virtual int endEntry() = 0;
  virtual int refuseEntry(const std::string& path, int code) = 0;
};

// Parses the reader's bytes as they arrive. A malformed frame ends it with EPROTO. It never holds more than
// one entry's head. One thread; may throw std::bad_alloc.
class ArchiveFrameParser {
 public:
  explicit ArchiveFrameParser(ArchiveFrameSink& sink) : sink_(sink) {}

  // Takes the next bytes. Returns 0 if it wants more bytes or has finished, else the errno value that ended
  // it: EPROTO, the sink's, or the failure that the reader reported. Do not call it again after that.
  int take(std::string_view bytes);
  // The most bytes that the next piece should have, so that large chunks arrive in pieces of their own.
  std::size_t bestPiece() const;
  // How many of the next bytes are a file's data and nothing else.
  std::size_t dataAhead() const { return inFrame_ && head_.type == archive_frame::Type::data ? left_ : 0; }
  // Skips this many data bytes: they were written elsewhere and do not go through take() and the sink.
  void pass(std::size_t bytes) {
    left_ -= static_cast<std::uint32_t>(bytes);
    inFrame_ = left_ > 0;
  }
  // Whether the reader has read the archive to its end; no byte may follow.
  bool hasFinished() const { return finished_; }

 private:
  int takeHead();
  int takeSmallFrame();
  int takeEntry();

  ArchiveFrameSink& sink_;
  archive_frame::Head head_{};
  std::string pending_;     // the part of a frame's head or of a small frame that has arrived
  bool inFrame_ = false;    // head_ is complete; its bytes are still to come
  std::uint32_t left_ = 0;  // bytes of the chunk still to come
  bool inEntry_ = false;
  archive_frame::Kind kind_ = archive_frame::Kind::file;
  std::uint32_t companionBytes_ = 0;  // of the entry
  bool lastWasLarge_ = false;
  bool finished_ = false;
};

}  // namespace brenvik
