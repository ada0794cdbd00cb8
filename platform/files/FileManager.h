// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace brenvik {

// The result of a file operation. A failure carries an errno value, or 0 if the platform did not say why.
class [[nodiscard]] FileOutcome {
 public:
  static constexpr FileOutcome success() { return FileOutcome(true, 0); }
  static constexpr FileOutcome failure(int code) { return FileOutcome(false, code); }
  static constexpr FileOutcome failureWithoutCode() { return FileOutcome(false, 0); }

  constexpr bool succeeded() const { return succeeded_; }
  // Returns 0 on success; on failure its code, or `otherwise` if it has none.
  constexpr int codeOr(int otherwise) const { return succeeded_ ? 0 : code_ != 0 ? code_ : otherwise; }
  constexpr bool operator==(const FileOutcome&) const = default;

 private:
  constexpr FileOutcome(bool succeeded, int code) : succeeded_(succeeded), code_(code) {}
  bool succeeded_;
  int code_;
};

enum class IfPresent {
  fail,                // EEXIST if the destination exists, even as a dangling link
  replaceNonDirectory  // replaces the item there in one step, unless it is a directory (EEXIST)
};

enum class Intermediates { mustExist, create };

enum class Durability {
  eventual,  // the system writes it to the disk when it sees fit
  onReturn   // success means that everything is on the disk, the names included
};

struct DirectoryAttributes {
  mode_t mode = 0755;          // exactly this, whatever the umask
  std::string_view ownerName;  // account names; empty: as the system gives
  std::string_view groupName;
};

// Changing the owner of a link changes the link itself, never its target. A link of another account is never
// given to root or to this account; such a change is skipped and counts as success.
struct ItemAttributes {
  std::optional<mode_t> mode;  // links are passed over
  std::optional<uid_t> uid;
  std::optional<gid_t> gid;
};

// Attributes that a copy gets before it has its name, so that nobody can put another item in its place. If
// the attributes cannot be set, the item appears without them.
struct Gift {
  ItemAttributes attributes;
  // Success if the item is at its place and has the attributes.
  FileOutcome outcome = FileOutcome::failureWithoutCode();
};

enum class ItemKinds { all, noFiles };

// Visits the items below a directory.
class ItemVisitor {
 public:
  enum class Next { descend, skipBelow };
  virtual ~ItemVisitor() = default;
  // `subpath`: relative to the directory enumerated, no leading slash. `isDirectory`: of the item itself,
  // links not followed. The result matters for directories only. Must not throw.
  virtual Next visit(const std::string& subpath, bool isDirectory) noexcept = 0;
};

// The platform's file manager. It handles whole items, with data, modes, owners (as far as permitted), times,
// links and extended attributes. Paths are NUL-terminated bytes. An item that is a link is copied, moved or
// removed as a link, and nothing is ever written through a link. On the path to an item that is made, changed
// or removed, a link is followed only if nobody but root and this account can have put it there; otherwise
// the operation fails as if the directory were missing. On the path to an item that is read or copied, links
// of root and this account are followed in any directory, unless their target contains "..".
//
// A copy or a move appears at its destination whole or not at all, even if the process is killed. A killed
// process leaves a hidden ".brenvik-" item beside the destination; the next operation in that folder removes
// it. Items with such names that another account has made are left alone.
//
// One thread at a time. Blocks only on the disk. Throws nothing: a lack of memory is ENOMEM.
class FileManager {
 public:
  virtual ~FileManager() = default;

  // Between openScope and closeScope, operations may keep temporary objects; scopes nest.
  virtual void openScope() noexcept = 0;
  virtual void closeScope() noexcept = 0;

  // Whether an item is at the path; follows a link there. If it is and `isDirectory` is not null, tells
  // whether it is a directory.
  virtual bool itemExists(const std::string& path, bool* isDirectory) noexcept = 0;

  // Both fail with EINVAL if a directory would end up inside itself. Within a file system, moveItem is one
  // rename; across two it copies, waits until the copy is on the disk, then removes the source. In the end
  // the item is whole at one of the two places: if something in the source cannot be removed (EBUSY: a mount;
  // EPERM: an immutable file; EROFS ...), it stays where it was. A source that ends in "." or ".." is EBUSY.
  // `gift` may be null.
  virtual FileOutcome copyItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                               Durability durability = Durability::eventual,
                               Gift* gift = nullptr) noexcept = 0;
  virtual FileOutcome moveItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                               Durability durability = Durability::eventual) noexcept = 0;
  // Removes the item and everything below it.
  virtual FileOutcome removeItem(const std::string& path) noexcept = 0;
  // Removes a file, a link or an empty directory. On success, the removal is on the disk.
  virtual FileOutcome removeEntry(const std::string& path) noexcept = 0;

  // Makes a symbolic link at the path; on success it is on the disk. It replaces the item there in one step;
  // a directory only if it is empty. If the link cannot be made, the old item stays.
  virtual FileOutcome placeLink(const std::string& path, const std::string& target) noexcept = 0;

  // Waits until the item, its attributes, everything below it and its name are on the disk.
  virtual FileOutcome syncItem(const std::string& path) noexcept = 0;

  // With `create`, a directory that already exists is a success, and only the directories made get the
  // attributes. On success they are on the disk.
  virtual FileOutcome createDirectory(const std::string& path, const DirectoryAttributes& attributes,
                                      Intermediates intermediates) noexcept = 0;

  // Appends the names of the entries, without "." and "..", in no particular order.
  virtual FileOutcome listDirectory(const std::string& path, std::vector<std::string>* names) noexcept = 0;

  // Calls the visitor for everything below the directory, each directory before its contents. The names in a
  // directory are read when it is entered; the visitor may change the tree meanwhile. Links below are not
  // followed; a link at the path itself counts as one on the path to an item. Returns the first failure to
  // read a directory.
  virtual FileOutcome enumerateBelow(const std::string& path, ItemVisitor& visitor) noexcept = 0;

  // Changes exactly the item that it has checked, even if the path is replaced meanwhile. With `noFiles`, a
  // regular file is EINVAL. A file with several names (hard links) is EPERM, because the others may be
  // anywhere, unless the file belongs to the owner of its directory and nobody else may write there.
  virtual FileOutcome setAttributes(const std::string& path, const ItemAttributes& attributes,
                                    ItemKinds kinds = ItemKinds::all) noexcept = 0;
  // The same for everything below a directory, then for the item at the path. Continues past items that
  // cannot be changed. Returns the failure of the item at the path, else the last failure below it.
  virtual FileOutcome setAttributesOfTree(const std::string& path,
                                          const ItemAttributes& attributes) noexcept = 0;

  // Returns the bytes of a regular file; nothing if it is missing, longer than `limit` bytes, unreadable or
  // not a regular file. Never waits for a writer.
  virtual std::optional<std::string> readFile(const std::string& path, std::size_t limit) noexcept = 0;

  // Writes a file so that it has the old content or the new, durably, never a part. The new file keeps the
  // mode and owner of the old one; a link is replaced, not followed. Returns false on failure.
  virtual bool writeFileAtomically(const std::string& path, std::string_view bytes) noexcept = 0;
  // Truncates the file and writes in place, or makes it. Refuses a link. Returns false on failure.
  virtual bool writeFile(const std::string& path, std::string_view bytes) noexcept = 0;
};

}  // namespace brenvik
