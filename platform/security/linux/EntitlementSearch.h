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

// Whom the files are asked about: a process that sent a message, or one that somebody wonders about.
class EntitlementCandidate {
 public:
  virtual ~EntitlementCandidate() = default;
  virtual uid_t uid() const noexcept = 0;
  // The file it executes, the same for the life of this object; nothing when there is none or it is not
  // known.
  virtual const std::optional<CallerProcess::FileIdentity>& executable() noexcept = 0;
  // The file it executes now, open for reading; not valid when it cannot be opened, errno says why.
  virtual UniqueFd openExecutable() noexcept = 0;
  // Its unit of the system's service manager; empty when in none.
  virtual const std::string& unit() = 0;
};

// One step of a search, for people.
struct EntitlementFinding {
  enum class Kind : std::uint8_t {
    holds,    // it is so of the candidate
    differs,  // it is not so: the file does not match
    wrong,    // it makes the file or directory passed over, whoever asks
    unknown,  // it cannot be found out now: the search ends without an answer
    note,     // worth knowing; decides nothing
  };
  std::string path;  // the directory or file
  std::string key;   // the key of the file; empty for the file or directory as a whole
  Kind kind;
  std::string text;  // "is root", "does not exist": to stand behind the key or the path
};

// The property-list files in which the administrator says who holds which entitlement (this folder's
// neighbour README.md says what stands in them). They are read afresh for each search, in order, until one
// answers. What is wrong with a file or directory is logged once for each state of it. Any thread; throws
// nothing but std::bad_alloc.
class EntitlementSearch {
 public:
  // Earlier directories first. `accounts` must outlive this object.
  EntitlementSearch(AccountDirectory& accounts, std::vector<std::string> directories);

  struct Result {
    PropertyList value;  // none when no file gives one
    bool error = false;  // a file that might matter could not be examined
    std::string file;    // the one that gave the value
  };
  // With `findings` each step is told there and nothing is logged; files that do not match are then compared
  // in every key. The result is the same.
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
  // Whether this was not logged yet.
  bool isNews(const std::string& path, FileState state);
  void forget(const std::string& path) noexcept;

  AccountDirectory& accounts_;
  const std::vector<std::string> directories_;
  std::mutex mutex_;
  std::map<std::string, FileState, std::less<>> told_;
};

// The directories named at build time (BRENVIK_ENTITLEMENT_DIRECTORIES).
std::vector<std::string> entitlementDirectories();

// Why a search gave no value true, in half a sentence: which file came nearest, and which of its keys is to
// blame.
std::string whyNotEntitled(const EntitlementSearch::Result& result,
                           const std::vector<EntitlementFinding>& findings);

}  // namespace brenvik
