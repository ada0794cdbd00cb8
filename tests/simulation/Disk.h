// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <functional>
#include <map>
#include <string>

#include "World.h"

namespace brenvik::simulation {

// An item of a tree of files, as it is compared and put back.
struct Item {
  mode_t mode = 0;      // type and permissions
  std::string content;  // of a file; of a link, its target
  uid_t uid = 0;
  gid_t gid = 0;
  bool operator==(const Item&) const = default;
};
// By path, below the root.
using Tree = std::map<std::string, Item>;

// The machine's only file system: a tmpfs that is this process's root, so that the helper's own files are the
// real ones. It knows what was synced, and so what a power cut can leave of it: of everything that was not
// synced the old or the new, in any order; what one rename has moved, together.
//
// The program is linked so that its calls of fsync() and the like come here first.
class Disk {
 public:
  // Mounts it in a mount namespace of this process's own, and makes it the root. Throws std::runtime_error.
  static void enter();
  static Disk& shared();

  // Empties it, and makes `tree`, all of it synced.
  void restore(const Tree& tree);
  Tree read() const;
  // What a power cut at this moment leaves.
  Tree afterPowerCut(Random& random) const;

  // Calls `then` at the nth change or sync from now on (1: the next one), before it is made.
  void countDown(long nth, std::function<void()> then) {
    left_ = nth;
    then_ = std::move(then);
  }
  void stopCounting() { left_ = 0; }

  // For the wrapped calls.
  void beforeChange();
  void synced(int file);
  void syncedAll();

 private:
  struct Name {
    ino_t inode = 0;
    Item item;
    bool operator==(const Name& other) const { return inode == other.inode; }
  };
  using Names = std::map<std::string, Name>;
  struct Inode {
    Item item;
    Names names;  // of a directory
  };
  class Cut;

  static Names namesIn(const std::string& path);
  void syncBelow(const std::string& path);

  std::map<ino_t, Inode> synced_;
  long left_ = 0;
  std::function<void()> then_;
};

}  // namespace brenvik::simulation
