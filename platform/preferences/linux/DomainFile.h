// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/base/UniqueFd.h"
#include "platform/plist/EditableDictionary.h"

namespace brenvik {

// The place of a domain's file, and the folders that are made for it.
struct DomainPlace {
  std::string root;    // exists, or nothing can be stored
  std::string folder;  // below root, relative
  std::string name;    // of the file, one component
  mode_t folderMode;   // of folders that are made
  mode_t fileMode;

  std::string path() const { return root + "/" + folder + "/" + name; }
};

// Tells one state of a file from another.
struct FileStamp {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = -1;            // negative: there is no file
  std::int64_t modified = 0;  // ns

  bool operator==(const FileStamp&) const = default;
};

// The exclusive right to write in one folder, for all writers of preferences on this machine. The destructor
// gives it up. It is a lock on a separate file, which stays.
class FolderLock {
 public:
  FolderLock() = default;
  bool isHeld() const noexcept { return file_.isValid(); }
  // Returns 0 or an errno; EWOULDBLOCK if others held it for all of `patience`.
  int take(int folder, std::chrono::milliseconds patience) noexcept;

 private:
  UniqueFd file_;
};

// The file of one domain, which is read and replaced as a whole. It logs every failure, once. One thread at a
// time. May throw std::bad_alloc.
class DomainFile {
 public:
  explicit DomainFile(DomainPlace place) : place_(std::move(place)), path_(place_.path()) {}

  const std::string& path() const noexcept { return path_; }

  enum class State {
    absent,
    read,
    unavailable,  // there may be a file that must not be overwritten
  };
  struct Loaded {
    State state = State::absent;
    EditableDictionary values;
    FileStamp stamp;
    // Keeps the inode's number from being given to another file as long as the stamp is compared.
    UniqueFd pin;
    // False: the file is so new that it could change again within the same tick of the file system's clock,
    // or it could not be read for a reason that says nothing about it. Look again the next time.
    bool isSettled = true;
  };
  // Reads the file. Moves a damaged or unreadable file aside, under the lock, which it takes for that time if
  // `held` does not hold it.
  Loaded load(std::chrono::milliseconds patience, const FolderLock* held);

  // The stamp of the file that is there now; links are followed.
  FileStamp stamp() const noexcept;

  // Opens the folder, with everything missing below the root made durably. Invalid on failure.
  UniqueFd openFolder() const noexcept;
  bool lock(int folder, std::chrono::milliseconds patience, FolderLock& lock) const noexcept;

  // Replaces the old file with a new one, which is durable when this returns true. On failure the old file
  // stays, unless only syncing the folder failed. The caller must hold the lock.
  bool replace(int folder, std::span<const std::string_view> content, FileStamp& stamp,
               UniqueFd& pin) const noexcept;

 private:
  struct Attempt {
    Loaded loaded;
    const char* damage = nullptr;  // what is wrong with the file, if anything
    int error = 0;                 // and the errno that says so, or 0

    // The file is not to blame.
    void fail(int why) noexcept {
      loaded.state = State::unavailable;
      loaded.isSettled = false;
      error = why;
    }
    void damaged(const char* what, int why = 0) noexcept {
      loaded.state = State::unavailable;
      error = why;
      damage = what;
    }
  };
  Attempt tryLoad() const;
  static void readContent(Attempt& attempt, std::string& bytes);
  bool moveAside(int folder, const Attempt& attempt) const;
  bool fail(const char* call, int error) const noexcept;

  DomainPlace place_;
  std::string path_;
};

}  // namespace brenvik
