// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/ZipArchiveCopier.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <new>
#include <vector>

#include "platform/files/linux/Durability.h"
#include "platform/files/linux/Placement.h"
#include "platform/files/linux/ReaderProcess.h"
#include "platform/files/linux/StagedMerge.h"
#include "platform/files/linux/UnpackWriter.h"

namespace brenvik {
namespace {

constexpr const char* kReaderName = "brenvik-archive-reader";
constexpr mode_t kDirectoryMode = 0755;

bool isOn(const PropertyList& options, const char* name) {
  return options.find(name).asBoolean().value_or(false);
}

std::string findReader() {
  char self[PATH_MAX];
  const ssize_t length = ::readlink("/proc/self/exe", self, sizeof self - 1);
  if (length > 0) {
    std::string path(self, static_cast<std::size_t>(length));
    path.resize(path.rfind('/') + 1);
    path += kReaderName;
    if (::access(path.c_str(), X_OK) == 0) return path;
  }
  std::string installed = BRENVIK_ARCHIVE_READER_DIRECTORY;
  installed += '/';
  installed += kReaderName;
  return ::access(installed.c_str(), X_OK) == 0 ? installed : std::string();
}

// 0 or errno: EINVAL for what is no regular file.
int openArchive(const std::string& path, UniqueFd* archive) {
  // O_NONBLOCK: a FIFO would hold the main loop until somebody writes.
  if (const int error = openToRead(path, O_RDONLY | O_NONBLOCK | O_NOCTTY, archive); error != 0) return error;
  struct stat info {};
  if (::fstat(archive->get(), &info) != 0) return errno;
  return S_ISREG(info.st_mode) ? 0 : EINVAL;
}

// Where the archive goes. The stage stands in place.directory, on the file system of the destination: inside
// a destination that is there, else beside the first directory on its way that has to be made.
struct Destination {
  UniqueFd existing;  // the destination, when it is there
  Place place;
  std::vector<std::string>
      below;  // what has to be made below the place, so that a failure leaves none behind
};

// For a destination that is not there. 0 or errno: EEXIST for a path with ".." in its missing part, which
// leads nowhere that can be made.
int findMissing(std::string path, Destination* missing) {
  for (;;) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    const int error = Place::open(path, &missing->place);
    if (error == 0) break;
    const std::size_t slash = path.rfind('/');
    const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
    const bool isHere = error == EEXIST && name == ".";
    if ((error != ENOENT && !isHere) || slash == std::string::npos || slash == 0) return error;
    if (!isHere) missing->below.push_back(name);
    path.resize(slash);
  }
  std::reverse(missing->below.begin(), missing->below.end());
  return 0;
}

// 0 or errno.
int findDestination(const std::string& path, Destination* found) {
  const int error = openDirectory(path, &found->place.directory);
  if (error == ENOENT) return findMissing(path, found);
  if (error != 0) return error;
  found->existing.reset(::openat(found->place.directory.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return found->existing.isValid() ? 0 : errno;
}

// Makes the names below the directory, one in the other, and opens the last. 0 or errno.
int makeBelow(int directory, const std::vector<std::string>& names, UniqueFd* last) {
  last->reset(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (const std::string& name : names) {
    if (!last->isValid() || ::mkdirat(last->get(), name.c_str(), 0700) != 0) return errno;
    last->reset(::openat(last->get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!last->isValid() || ::fchmod(last->get(), kDirectoryMode) != 0) return errno;
  }
  return last->isValid() ? 0 : errno;
}

// Both show the finished stage. Before a name shows, what it stands for is on the disk; and the answer waits
// for the names. 0 or errno.
int merge(const Stage& stage, int existing) {
  if (const int error = checkMerge(stage.get(), existing); error != 0) return error;
  if (const int error = syncFileSystem(stage.get()); error != 0) return error;
  if (const int error = mergeStaged(stage.get(), existing); error != 0) return error;
  return syncFileSystem(existing);
}

int publish(Stage& stage, int directory) {
  if (::fchmod(stage.get(), kDirectoryMode) != 0) return errno;
  if (const int error = syncFileSystem(stage.get()); error != 0) return error;
  if (const int error = stage.publish(IfPresent::fail); error != 0) return error;
  return syncNames(directory);
}

// The reader's frames on their way to the writer.
class Unpacking final : public ReaderOutput {
 public:
  Unpacking(ArchiveFrameParser& parser, UnpackWriter& writer) : parser_(parser), writer_(writer) {}
  int take(std::string_view bytes) override { return parser_.take(bytes); }
  std::size_t bestPiece() const override { return parser_.bestPiece(); }
  bool isComplete() const override { return parser_.hasFinished(); }
  // No more than the entry said and the cap allows: what is beyond goes through take(), which refuses it.
  Direct direct() const override {
    const UnpackWriter::Room room = writer_.roomForData();
    return {room.file, std::min(room.bytes, parser_.dataAhead())};
  }
  void wentDirectly(std::size_t bytes) override {
    parser_.pass(bytes);
    writer_.dataWritten(bytes);
  }

 private:
  ArchiveFrameParser& parser_;
  UnpackWriter& writer_;
};

}  // namespace

ArchiveCopierFactory ZipArchiveCopier::factory() {
  return []() -> std::unique_ptr<ArchiveCopier> {
    // Looked for each time: an update of the package may put it elsewhere under a running helper.
    std::string reader = findReader();
    if (reader.empty()) return nullptr;
    return std::make_unique<ZipArchiveCopier>(std::move(reader));
  };
}

int ZipArchiveCopier::unpack(const std::string& archive, const std::string& destination,
                             const PropertyList& options, bool* wasAnswered) {
  if (!isOn(options, "extractPKZip")) return ENOTSUP;
  const auto deadline = std::chrono::steady_clock::now() + longest_;
  UniqueFd input;
  if (const int error = openArchive(archive, &input); error != 0) return error;
  Destination target;
  if (const int error = findDestination(destination, &target); error != 0) return error;

  removeLeftovers(target.place.directory.get());
  Stage stage(target.place);
  if (const int error = stage.makeDirectory(); error != 0) return error;
  struct statvfs disk {};
  if (::fstatvfs(stage.get(), &disk) != 0) return errno;
  UniqueFd top;
  if (const int error = makeBelow(stage.get(), target.below, &top); error != 0) return error;
  UnpackWriter writer(top.get(), {isOn(options, "copyExtendedAttributes"), isOn(options, "copyResources")},
                      std::uint64_t{disk.f_bavail} * disk.f_frsize, onFileError_);
  const int error = readInto(writer, input.get(), deadline);
  *wasAnswered = writer.wasStoppedByAnswer();
  if (error != 0) return error;
  return target.existing.isValid() ? merge(stage, target.existing.get())
                                   : publish(stage, target.place.directory.get());
}

int ZipArchiveCopier::readInto(UnpackWriter& writer, int archive,
                               std::chrono::steady_clock::time_point deadline) {
  ArchiveFrameParser parser(writer);
  {
    ReaderProcess reader;
    if (const int error = reader.start(reader_, archive); error != 0) return error;
    Unpacking unpacking(parser, writer);
    if (const int error = reader.drain(deadline, unpacking); error != 0) return error;
  }
  return writer.finish();
}

int ZipArchiveCopier::copy(const std::string& archive, const std::string& destination,
                           const PropertyList& options) noexcept {
  int error = ENOMEM;
  bool wasAnswered = false;
  try {
    error = unpack(archive, destination, options, &wasAnswered);
  } catch (const std::bad_alloc&) {
  }
  if (error != 0 && !wasAnswered && onFatalError_) onFatalError_(error);
  return error;
}

}  // namespace brenvik
