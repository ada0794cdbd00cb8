// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <string>

#include "platform/base/UniqueFd.h"
#include "platform/files/FileManager.h"
#include "platform/files/linux/Way.h"

namespace brenvik {

// Removes what killed processes have left in the directory: what a Stage or placeLink() had made there, and
// nothing else. Placement.cpp says how it recognises them (hidden names). May throw std::bad_alloc.
void removeLeftovers(int directory);

// Makes a symbolic link at the place. What stands there gives way in one step; an empty directory is removed
// first. 0, or errno and nothing has changed.
int placeLink(const Place& place, const std::string& target);

// A new item in the making. It stands in a hidden directory beside its place, which only this process's
// account may enter, or has no name at all, until it shows at its place whole. One thread.
class Stage {
 public:
  enum class Undo { no, possible };

  // `place` outlives the object. With Undo::possible a publication can be taken back.
  explicit Stage(const Place& place, Undo undo = Undo::no) : place_(place), undo_(undo) {}
  Stage(const Stage&) = delete;
  Stage& operator=(const Stage&) = delete;
  // Removes what was not published, and what gave way.
  ~Stage();

  // Make the item: an empty directory (mode 0700), an empty file (mode 0600), or nothing yet: then the caller
  // makes one as itemName() in room(). 0 or errno.
  int makeDirectory();
  int makeFile();
  int makeRoom();

  int get() const noexcept { return fd_.get(); }  // of the directory or file
  int room() const noexcept { return room_.get(); }
  static const char* itemName() noexcept { return "new"; }

  // Shows the item under the place's name. 0 or errno: EEXIST when something is there that does not give way.
  int publish(IfPresent ifPresent);
  // Takes the item away from its place, and puts back what gave way. 0 or errno. Only after publish(), and
  // with Undo::possible.
  int takeBack();

  // The other way round: the item with this information goes from the place into the room, in one step, and
  // away with this object. 0 or errno; then it stands where it stood. After makeRoom().
  int take(const struct stat& info);

 private:
  int publishUnnamed(IfPresent ifPresent);
  int publishFromRoom(IfPresent ifPresent);

  const Place& place_;
  const Undo undo_;
  std::string roomName_;  // empty: there is no room
  UniqueFd room_;
  UniqueFd fd_;
  bool isUnnamed_ = false;
  bool exchanged_ = false;  // what gave way stands in the room
};

}  // namespace brenvik
