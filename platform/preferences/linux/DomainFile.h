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

// Where a domain's file is, and what is made for it when it is missing.
struct DomainPlace {
  std::string root;    // exists, or nothing can be stored
  std::string folder;  // below root, relative
  std::string name;    // of the file, one component
  mode_t folderMode;   // of folders that are made
  mode_t fileMode;

  std::string path() const { return root + "/" + folder + "/" + name; }
};

// What tells one state of a file from another.
struct FileStamp {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = -1;            // negative: there is no file
  std::int64_t modified = 0;  // ns

  bool operator==(const FileStamp&) const = default;
};

// The exclusive right of writing in one folder, shared by all writers of preferences on this machine; gone
// with the object. What holds it is an open-file lock on a file of its own, which stays.
class FolderLock {
 public:
  FolderLock() = default;
  bool isHeld() const noexcept { return file_.isValid(); }
  // 0, or an errno; EWOULDBLOCK when others kept it for as long as `patience`.
  int take(int folder, std::chrono::milliseconds patience) noexcept;

 private:
  UniqueFd file_;
};

// The file of one domain: reads it whole, replaces it whole. Every failure is logged here, once. Not for
// several threads at once. May throw std::bad_alloc.
class DomainFile {
 public:
  explicit DomainFile(DomainPlace place) : place_(std::move(place)), path_(place_.path()) {}

  const std::string& path() const noexcept { return path_; }

  enum class State {
    absent,
    read,
    unavailable,  // perhaps there is something that must not be written over
  };
  struct Loaded {
    State state = State::absent;
    EditableDictionary values;
    FileStamp stamp;
    // Keeps the inode's number from being given to another file as long as the stamp is compared.
    UniqueFd pin;
    // False: so young that it could change once more within the file system's clock tick.
    bool isSettled = true;
  };
  // Reads the file. A damaged or unreadable one is moved aside, which needs the lock: when `held` does not
  // hold it, it is taken for as long as that takes.
  Loaded load(std::chrono::milliseconds patience, const FolderLock* held);

  // The stamp of what stands there now; links are followed.
  FileStamp stamp() const noexcept;

  // Opens the folder, with everything missing below the root made durably. Invalid on failure.
  UniqueFd openFolder() const noexcept;
  bool lock(int folder, std::chrono::milliseconds patience, FolderLock& lock) const noexcept;

  // Puts a new file in the old one's place, durable when this returns true. On failure the old one stands,
  // unless only the folder could not be synced any more. With the lock held.
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
      error = why;
    }
    void damaged(const char* what, int why = 0) noexcept {
      fail(why);
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
