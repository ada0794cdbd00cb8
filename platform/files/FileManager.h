// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace brenvik {

// How a file operation ended. A failure carries an errno value, or 0 when the platform did not say why.
class [[nodiscard]] FileOutcome {
 public:
  static constexpr FileOutcome success() { return FileOutcome(true, 0); }
  static constexpr FileOutcome failure(int code) { return FileOutcome(false, code); }
  static constexpr FileOutcome failureWithoutCode() { return FileOutcome(false, 0); }

  constexpr bool succeeded() const { return succeeded_; }
  // 0 on success; on failure its code, or `otherwise` when there is none.
  constexpr int codeOr(int otherwise) const { return succeeded_ ? 0 : code_ != 0 ? code_ : otherwise; }
  constexpr bool operator==(const FileOutcome&) const = default;

 private:
  constexpr FileOutcome(bool succeeded, int code) : succeeded_(succeeded), code_(code) {}
  bool succeeded_;
  int code_;
};

enum class IfPresent {
  fail,                // EEXIST when anything, a dangling link included, stands at the destination
  replaceNonDirectory  // what stands there gives way in one step, unless it is a directory (EEXIST)
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

// The owner of a link is its own, never that of what it points to. Other accounts' links do not become root's
// or this account's; such a change counts as done.
struct ItemAttributes {
  std::optional<mode_t> mode;  // links are passed over
  std::optional<uid_t> uid;
  std::optional<gid_t> gid;
};

// What the item that a copy makes is given before it has its name, so that nothing else can be given away in
// its place. An item that cannot have the attributes is shown without them.
struct Gift {
  ItemAttributes attributes;
  // Success if the item stands at its place and has the attributes.
  FileOutcome outcome = FileOutcome::failureWithoutCode();
};

enum class ItemKinds { all, noFiles };

// Is told of the items below a directory.
class ItemVisitor {
 public:
  enum class Next { descend, skipBelow };
  virtual ~ItemVisitor() = default;
  // `subpath`: relative to the directory enumerated, no leading slash. `isDirectory`: of the item itself,
  // links not followed. The answer counts for directories only. Must not throw.
  virtual Next visit(const std::string& subpath, bool isDirectory) noexcept = 0;
};

// The platform's file manager: whole items, with data, modes, owners (as far as permitted), times, links and
// extended attributes. Paths are NUL-terminated bytes. A link that is itself the item is copied, moved or
// removed as a link, and nothing is ever written through one. On the way to what is made, changed or removed,
// a link is followed only when nobody but root and this account can have put it there; else the operation
// fails as if the directory were missing. On the way to what is read or copied, root's and this account's own
// links are followed wherever they stand, unless ".." is in their target.
//
// A copy or a move shows at its destination whole or not at all, even when the process is killed. What a
// killed process leaves is a hidden ".brenvik-" item beside the destination; the next operation in that
// folder removes it. Items of such names that somebody else has made are left alone.
//
// One thread at a time. Blocks on the disk and nothing else. Throws nothing: memory exhaustion is ENOMEM.
class FileManager {
 public:
  virtual ~FileManager() = default;

  // Temporaries of the operations may live from openScope to closeScope; scopes nest.
  virtual void openScope() noexcept = 0;
  virtual void closeScope() noexcept = 0;

  // Whether anything is at the path, a link that is itself the item followed; then, if asked, whether it is a
  // directory.
  virtual bool itemExists(const std::string& path, bool* isDirectory) noexcept = 0;

  // Fail with EINVAL when a directory would come to stand inside itself. moveItem is one rename inside a file
  // system; across two it copies, waits until the copy is on the disk, then removes the source. It ends with
  // the item whole at one of the two places: where something in the source cannot be removed (EBUSY: a mount;
  // EPERM: an immutable file; EROFS ...), it stays where it was. A source that ends in "." or ".." is EBUSY.
  // `gift` may be null.
  virtual FileOutcome copyItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                               Durability durability = Durability::eventual,
                               Gift* gift = nullptr) noexcept = 0;
  virtual FileOutcome moveItem(const std::string& source, const std::string& destination, IfPresent ifPresent,
                               Durability durability = Durability::eventual) noexcept = 0;
  // With everything below it.
  virtual FileOutcome removeItem(const std::string& path) noexcept = 0;
  // A file, a link or an empty directory; on the disk when it succeeds.
  virtual FileOutcome removeEntry(const std::string& path) noexcept = 0;

  // A symbolic link at the path, on the disk when it succeeds. What stands there gives way in one step, a
  // directory only if it is empty. When the link cannot be made, what was there stays.
  virtual FileOutcome placeLink(const std::string& path, const std::string& target) noexcept = 0;

  // Waits until the item, its attributes, everything below it and its name are on the disk.
  virtual FileOutcome syncItem(const std::string& path) noexcept = 0;

  // With `create`, a directory that is there already is a success, and the attributes go to those made. What
  // is made is on the disk when it succeeds.
  virtual FileOutcome createDirectory(const std::string& path, const DirectoryAttributes& attributes,
                                      Intermediates intermediates) noexcept = 0;

  // Appends the names of the entries, without "." and "..", in no particular order.
  virtual FileOutcome listDirectory(const std::string& path, std::vector<std::string>* names) noexcept = 0;

  // Calls the visitor for everything below the directory, each directory before what is in it. The names of a
  // directory are read when it is descended into; the visitor may change the tree meanwhile. Links below are
  // not followed, and a link at the path itself counts as one on the way. The failure reported is the first
  // that kept a directory from being read.
  virtual FileOutcome enumerateBelow(const std::string& path, ItemVisitor& visitor) noexcept = 0;

  // Changes the very item that it has looked at. With `noFiles`, a regular file is EINVAL. A file with
  // further names (hard links), which may stand anywhere, is EPERM unless it belongs to the owner of the
  // directory it was found in and nobody else may write there.
  virtual FileOutcome setAttributes(const std::string& path, const ItemAttributes& attributes,
                                    ItemKinds kinds = ItemKinds::all) noexcept = 0;
  // The same for everything below a directory, then for the item at the path. Goes on past what cannot be
  // changed. Reports the failure of the item at the path, else the last one below it.
  virtual FileOutcome setAttributesOfTree(const std::string& path,
                                          const ItemAttributes& attributes) noexcept = 0;

  // The bytes of a regular file, at most `limit` of them; nothing when it is missing, larger, unreadable or
  // not a regular file. Never waits for a writer.
  virtual std::optional<std::string> readFile(const std::string& path, std::size_t limit) noexcept = 0;

  // The old content or the new, durably, never a part. A file that is there passes its mode and owner on; a
  // link that is there is replaced, not followed.
  virtual bool writeFileAtomically(const std::string& path, std::string_view bytes) noexcept = 0;
  // Truncates and writes in place, like a stream that was opened on the path. Refuses a link.
  virtual bool writeFile(const std::string& path, std::string_view bytes) noexcept = 0;
};

}  // namespace brenvik
