// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/archive/ArchiveFrames.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace brenvik {

using archive_frame::EntryHead;
using archive_frame::Head;
using archive_frame::Kind;
using archive_frame::Refusal;
using archive_frame::Type;

namespace {

constexpr int kOtherFailure = EIO;  // for a failure whose code makes no sense

int plausible(std::int32_t code) { return code > 0 && code < 4096 ? code : kOtherFailure; }

}  // namespace

int ArchiveFrameParser::takeHead() {
  std::memcpy(&head_, pending_.data(), sizeof head_);
  pending_.clear();
  const std::uint32_t length = head_.length;
  switch (head_.type) {
    case Type::entry:
      if (inEntry_ || length < sizeof(EntryHead) ||
          length > sizeof(EntryHead) + 2 * archive_frame::kLongestPath) {
        return EPROTO;
      }
      break;
    case Type::data:
      if (!inEntry_ || kind_ != Kind::file || length > archive_frame::kLargestChunk) return EPROTO;
      left_ = length;
      break;
    case Type::companion:
      if (!inEntry_ || length > archive_frame::kLargestChunk ||
          length > archive_frame::kLargestCompanion - companionBytes_) {
        return EPROTO;
      }
      companionBytes_ += length;
      left_ = length;
      break;
    case Type::endOfEntry:
      if (!inEntry_ || length != 0) return EPROTO;
      inEntry_ = false;
      return sink_.endEntry();
    case Type::end:
      if (inEntry_ || length != 0) return EPROTO;
      finished_ = true;
      return 0;
    case Type::refused:
      if (inEntry_ || length < sizeof(Refusal) || length > sizeof(Refusal) + archive_frame::kLongestPath) {
        return EPROTO;
      }
      break;
    case Type::failed:
      if (length != sizeof(Refusal)) return EPROTO;
      break;
    default:
      return EPROTO;
  }
  inFrame_ = length > 0;
  lastWasLarge_ = left_ >= archive_frame::kLargeChunk;
  return 0;
}

int ArchiveFrameParser::takeEntry() {
  EntryHead head;
  std::memcpy(&head, pending_.data(), sizeof head);
  if (sizeof head + head.pathLength + head.targetLength != pending_.size() ||
      head.pathLength > archive_frame::kLongestPath || head.targetLength > archive_frame::kLongestPath ||
      head.kind > Kind::link || head.mode > 0777 || (head.kind != Kind::link && head.targetLength != 0)) {
    return EPROTO;
  }
  ArchiveEntry entry;
  entry.kind = head.kind;
  entry.mode = head.mode;
  entry.size = head.size;
  entry.modified = head.modified;
  entry.path = pending_.substr(sizeof head, head.pathLength);
  entry.target = pending_.substr(sizeof head + head.pathLength);
  inEntry_ = true;
  kind_ = entry.kind;
  companionBytes_ = 0;
  return sink_.beginEntry(entry);
}

int ArchiveFrameParser::takeSmallFrame() {
  if (head_.type == Type::entry) return takeEntry();
  Refusal refusal;
  std::memcpy(&refusal, pending_.data(), sizeof refusal);
  if (head_.type == Type::failed) return plausible(refusal.code);
  return sink_.refuseEntry(pending_.substr(sizeof refusal), plausible(refusal.code));
}

std::size_t ArchiveFrameParser::bestPiece() const {
  if (left_ >= archive_frame::kLargeChunk) return left_;
  // Behind one large chunk there is usually another.
  return lastWasLarge_ && !inFrame_ ? sizeof(Head) - pending_.size()
                                    : std::size_t{archive_frame::kLargestChunk};
}

int ArchiveFrameParser::take(std::string_view bytes) {
  while (!bytes.empty()) {
    if (finished_) return EPROTO;
    if (!inFrame_) {
      const std::size_t part = std::min(bytes.size(), sizeof(Head) - pending_.size());
      pending_ += bytes.substr(0, part);
      bytes.remove_prefix(part);
      if (pending_.size() < sizeof(Head)) continue;
      if (const int error = takeHead(); error != 0) return error;
      continue;
    }
    if (head_.type == Type::data || head_.type == Type::companion) {
      const std::string_view chunk = bytes.substr(0, left_);
      bytes.remove_prefix(chunk.size());
      left_ -= static_cast<std::uint32_t>(chunk.size());
      inFrame_ = left_ > 0;
      const int error = head_.type == Type::data ? sink_.entryData(chunk) : sink_.entryCompanion(chunk);
      if (error != 0) return error;
      continue;
    }
    const std::size_t part = std::min(bytes.size(), head_.length - pending_.size());
    pending_ += bytes.substr(0, part);
    bytes.remove_prefix(part);
    if (pending_.size() < head_.length) continue;
    inFrame_ = false;
    const int error = takeSmallFrame();
    pending_.clear();
    if (error != 0) return error;
  }
  return 0;
}

}  // namespace brenvik
