// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

#include "platform/files/linux/FileContents.h"

namespace brenvik {

// Copies items from one directory into another, under names that must not exist there. Links stay links, hard
// links within one item stay hard links, FIFOs and sockets are made anew; device nodes are refused (EPERM).
// Stops at the first failure and leaves what was made to the caller. One thread; the functions may throw
// std::bad_alloc.
class TreeCopier {
 public:
  enum class Source {
    stays,
    goes  // will be removed: an item that cannot be (a mount, an immutable one) is a failure here already
  };

  // The owner of a file that this process makes, so that most files need no change of owner.
  TreeCopier(FileContents& contents, uid_t ownUid, gid_t ownGid, Source afterwards = Source::stays)
      : contents_(contents), ownUid_(ownUid), ownGid_(ownGid), afterwards_(afterwards) {}

  // Copies the regular file, its attributes included, into a file just made. 0 or errno.
  int copyFileInto(int source, const struct stat& info, int destination);

  // Copies everything in the directory `source` into the empty directory `destination` (mode 0700 and owned
  // by this process), then gives it the attributes of the source. 0 or errno.
  int copyDirectoryInto(int source, const struct stat& info, int destination);

  // Copies the link, FIFO or socket `name`. `info`: of the item itself. 0 or errno.
  int copySpecial(int sourceDirectory, const char* name, const struct stat& info, int destinationDirectory,
                  const char* destinationName);

 private:
  class CopyingWalk;

  int checkRemovable(int directory, const char* name) const;
  int copyRegular(int from, int to, const char* name, const std::string& path);
  // Makes a second name of an item that has been copied already under another one. False: copy it.
  bool linkAgain(const struct stat& info, int to, const char* name, const std::string& path);

  FileContents& contents_;
  const uid_t ownUid_;
  const gid_t ownGid_;
  const Source afterwards_;
  int top_ = -1;                                           // where directories are copied to
  mode_t umask_ = 0777;                                    // what creation takes from a mode
  std::map<std::pair<dev_t, ino_t>, std::string> linked_;  // files with several names: the first copy's path
};

// What creation in the directory takes from a mode.
mode_t umaskIn(int directory) noexcept;

}  // namespace brenvik
