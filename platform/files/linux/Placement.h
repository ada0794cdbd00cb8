// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/files/FileManager.h"

namespace brenvik {

// The directory an item is to stand in, opened, and the item's name there.
struct Place {
  UniqueFd directory;
  std::string name;

  // Opens the directory part of the path, links followed. 0 or errno; EEXIST for a path that names a
  // directory by itself ("/", "." or ".." at the end). May throw std::bad_alloc.
  static int open(const std::string& path, Place* place);
};

// A hidden item beside the place, in which a new item is made before it shows under its own name. Its name
// follows from the item's, so that the next attempt finds what a killed one has left. One thread.
class Stage {
 public:
  explicit Stage(const Place& place);
  Stage(const Stage&) = delete;
  Stage& operator=(const Stage&) = delete;
  // Removes what was not published.
  ~Stage();

  // Make the stage: an empty directory (mode 0700), an empty file (mode 0600; without a name where the file
  // system can), or nothing yet, only a free name. 0 or errno.
  int makeDirectory();
  int makeFile();
  int reserveName();

  int get() const noexcept { return fd_.get(); }
  const char* name() const noexcept { return name_.c_str(); }
  // After something was made under name() by another call: it is the stage's to remove.
  void nameIsTaken() noexcept { named_ = true; }

  // Shows the staged item under the place's name. 0 or errno: EEXIST when something is there that does not
  // give way. What gave way is removed.
  int publish(IfPresent ifPresent);

 private:
  void useName(int attempt);
  int clearStale();

  const Place& place_;
  std::string name_;
  UniqueFd fd_;
  bool named_ = false;
};

}  // namespace brenvik
