// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <ctime>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/accounts/AccountDirectory.h"
#include "platform/base/UniqueFd.h"
#include "platform/plist/PropertyList.h"
#include "platform/security/linux/CallerProcess.h"

namespace brenvik {

// The subject of a search: a process that sent a message, or one that somebody asks about.
class EntitlementCandidate {
 public:
  virtual ~EntitlementCandidate() = default;
  virtual uid_t uid() const noexcept = 0;
  // The file that it executes, the same for the life of this object; nothing if there is none or it is
  // unknown.
  virtual const std::optional<FileIdentity>& executable() = 0;
  // Its unit of the system's service manager; empty: none.
  virtual const std::string& unit() = 0;
};

// One step of a search, for people.
struct EntitlementFinding {
  enum class Kind : std::uint8_t {
    holds,    // the condition is true of the candidate
    differs,  // the condition is false, so the file does not match
    wrong,    // the file or directory is skipped for every candidate
    unknown,  // it cannot be found out now; the search ends without an answer
    note,     // worth knowing; decides nothing
  };
  std::string path;  // the directory or file
  std::string key;   // the key of the file; empty for the file or directory as a whole
  Kind kind;
  std::string text;  // follows the key or the path: "is root", "does not exist"
};

// Searches the property-list files in which the administrator says who holds which entitlement (../README.md
// describes them). It reads them again for each search, in order, until one answers. It logs each fault of a
// file or directory once for each state of that file. Any thread; throws only std::bad_alloc.
class EntitlementSearch {
 public:
  // Earlier directories first. `accounts` must outlive this object.
  EntitlementSearch(AccountDirectory& accounts, std::vector<std::string> directories);

  struct Result {
    PropertyList value;  // none if no file gives one
    bool error = false;  // a file that might matter could not be examined
    std::string file;    // the file that gave the value
  };
  // With `findings`, it records each step there and logs nothing, and compares every key even of files that
  // do not match. The result is the same.
  Result find(std::string_view name, EntitlementCandidate& candidate,
              std::vector<EntitlementFinding>* findings = nullptr);

  const std::vector<std::string>& directories() const noexcept { return directories_; }

 private:
  class Run;
  struct FileState {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    timespec modified{};
    timespec changed{};
    std::string reason;
  };
  // True if this was not logged yet.
  bool isNews(const std::string& path, FileState state);
  void forget(const std::string& path) noexcept;

  AccountDirectory& accounts_;
  const std::vector<std::string> directories_;
  std::mutex mutex_;
  std::map<std::string, FileState, std::less<>> told_;
};

// The directories named at build time (BRENVIK_ENTITLEMENT_DIRECTORIES).
std::vector<std::string> entitlementDirectories();

// Explains in half a sentence why a search gave no value true: the file that came nearest, and the key that
// did not match.
std::string whyNotEntitled(const EntitlementSearch::Result& result,
                           const std::vector<EntitlementFinding>& findings);

}  // namespace brenvik
