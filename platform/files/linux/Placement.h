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

// Removes the hidden items that a Stage or placeLink() of a killed process left in the directory, and nothing
// else. Placement.cpp says how it recognises them. May throw std::bad_alloc.
void removeLeftovers(int directory);

// Makes a symbolic link at the place. Replaces a non-directory there in one step; removes an empty directory
// first. Returns 0, or an errno if nothing has changed.
int placeLink(const Place& place, const std::string& target);

// A new item that is not yet visible. Until publish() it is in a hidden directory beside its place, which
// only this process's account may enter, or has no name at all. One thread.
class Stage {
 public:
  enum class Undo { no, possible };

  // `place` must outlive the object. With Undo::possible, takeBack() is possible.
  explicit Stage(const Place& place, Undo undo = Undo::no) : place_(place), undo_(undo) {}
  Stage(const Stage&) = delete;
  Stage& operator=(const Stage&) = delete;
  // Removes the item if it was not published, and the item that it replaced.
  ~Stage();

  // Make an empty directory (mode 0700), an empty file (mode 0600), or only the room: the caller then makes
  // the item as itemName() in room(). Return 0 or an errno.
  int makeDirectory();
  int makeFile();
  int makeRoom();

  int get() const noexcept { return fd_.get(); }  // of the directory or file
  int room() const noexcept { return room_.get(); }
  static const char* itemName() noexcept { return "new"; }

  // Moves the item to the place's name. Returns 0 or an errno; EEXIST if `ifPresent` does not let it replace
  // the item there.
  int publish(IfPresent ifPresent);
  // Takes the item away from its place and puts back the item that it replaced. Returns 0 or an errno. Only
  // after publish(), and with Undo::possible.
  int takeBack();

  // Moves the item with this `info` from the place into the room, in one step; the destructor removes it.
  // Returns 0, or an errno and leaves the item at its place. Only after makeRoom().
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
  bool exchanged_ = false;  // the replaced item is in the room
};

}  // namespace brenvik
