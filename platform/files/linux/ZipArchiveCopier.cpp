// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/files/linux/ZipArchiveCopier.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <new>

#include "platform/files/linux/LinuxFileManager.h"
#include "platform/files/linux/Placement.h"
#include "platform/files/linux/ReaderProcess.h"
#include "platform/files/linux/StagedMerge.h"
#include "platform/files/linux/UnpackWriter.h"

namespace brenvik {
namespace {

constexpr const char* kReaderName = "brenvik-archive-reader";

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
  // O_NONBLOCK: a FIFO would hold the main loop until somebody writes.
  const UniqueFd input(::open(archive.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  struct stat info {};
  if (!input.isValid() || ::fstat(input.get(), &info) != 0) return errno;
  if (!S_ISREG(info.st_mode)) return EINVAL;

  // Beside a destination that is still to be made, or inside one that is there: on its file system either
  // way.
  Place place;
  UniqueFd existing(::open(destination.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (existing.isValid()) {
    place.directory.reset(::openat(existing.get(), ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
    place.name = ".unpacked";  // only names the stage
    if (!place.directory.isValid()) return errno;
  } else {
    if (errno != ENOENT) return errno;
    int error = Place::open(destination, &place);
    if (error == ENOENT) {
      const std::size_t slash = destination.find_last_not_of('/') == std::string::npos
                                    ? std::string::npos
                                    : destination.rfind('/', destination.find_last_not_of('/'));
      if (slash == std::string::npos || slash == 0) return ENOENT;
      const FileOutcome made =
          LinuxFileManager().createDirectory(destination.substr(0, slash), {}, Intermediates::create);
      if (!made.succeeded()) return made.codeOr(EIO);
      error = Place::open(destination, &place);
    }
    if (error != 0) return error;
  }

  Stage stage(place);
  if (const int error = stage.makeDirectory(); error != 0) return error;
  struct statvfs disk {};
  if (::fstatvfs(stage.get(), &disk) != 0) return errno;
  UnpackWriter writer(stage.get(), {isOn(options, "copyExtendedAttributes"), isOn(options, "copyResources")},
                      std::uint64_t{disk.f_bavail} * disk.f_frsize, onFileError_);
  ArchiveFrameParser parser(writer);
  {
    ReaderProcess reader;
    if (const int error = reader.start(reader_, input.get()); error != 0) return error;
    const int error = reader.drain(
        deadline, [&](std::string_view bytes) { return parser.take(bytes); },
        [&] { return parser.bestPiece(); }, [&] { return parser.hasFinished(); });
    *wasAnswered = writer.wasStoppedByAnswer();
    if (error != 0) return error;
  }
  if (existing.isValid()) {
    if (const int error = checkMerge(stage.get(), existing.get()); error != 0) return error;
    return mergeStaged(stage.get(), existing.get());
  }
  if (::fchmod(stage.get(), 0755) != 0) return errno;
  return stage.publish(IfPresent::fail);
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
