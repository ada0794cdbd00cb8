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
// Stops at the first failure; the caller removes what was already made. One thread; the functions may throw
// std::bad_alloc.
class TreeCopier {
 public:
  enum class Source {
    stays,
    goes  // will be removed; so an item that cannot be removed (a mount, an immutable file) fails the copy
  };

  // `ownUid` and `ownGid` own the files that this process makes, so that most files need no change of owner.
  TreeCopier(FileContents& contents, uid_t ownUid, gid_t ownGid, Source afterwards = Source::stays)
      : contents_(contents), ownUid_(ownUid), ownGid_(ownGid), afterwards_(afterwards) {}

  // Copies the regular file, its attributes included, into a file just made. Returns 0 or an errno.
  int copyFileInto(int source, const struct stat& info, int destination);

  // Copies everything in the directory `source` into the empty directory `destination` (mode 0700 and owned
  // by this process), then gives it the attributes of the source. Returns 0 or an errno.
  int copyDirectoryInto(int source, const struct stat& info, int destination);

  // Copies the link, FIFO or socket `name`. `info` describes the item itself. Returns 0 or an errno.
  int copySpecial(int sourceDirectory, const char* name, const struct stat& info, int destinationDirectory,
                  const char* destinationName);

 private:
  class CopyingWalk;

  int checkRemovable(int directory, const char* name) const;
  int copyRegular(int from, int to, const char* name, const std::string& path);
  // If the item was already copied under another name, links to that copy. Returns false if it must be
  // copied.
  bool linkAgain(const struct stat& info, int to, const char* name, const std::string& path);

  FileContents& contents_;
  const uid_t ownUid_;
  const gid_t ownGid_;
  const Source afterwards_;
  int top_ = -1;                                           // where directories are copied to
  mode_t umask_ = 0777;                                    // the bits that creation removes from a mode
  std::map<std::pair<dev_t, ino_t>, std::string> linked_;  // files with several names: the first copy's path
};

// The mode bits that the kernel removes when an item is made in the directory, by the umask or a default ACL.
// 0777 if that cannot be found out.
mode_t umaskIn(int directory) noexcept;

}  // namespace brenvik
