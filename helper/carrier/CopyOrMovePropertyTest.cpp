// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
//
// Random trees, random copies and moves: what is on the disk afterwards is what a small model of the rules
// says, written from the rules alone and on a tree in memory.
#include <dirent.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "helper/carrier/FileSystemManager.h"
#include "platform/files/fakes/TemporaryDirectory.h"
#include "platform/files/linux/LinuxFileManager.h"

namespace brenvik {
namespace {

enum class Kind { file, directory, link };

struct Node {
  Kind kind = Kind::directory;
  std::string text;  // content of a file, target of a link (from the model's root)
  std::map<std::string, std::unique_ptr<Node>> children;

  std::unique_ptr<Node> clone() const {
    auto copy = std::make_unique<Node>();
    copy->kind = kind;
    copy->text = text;
    for (const auto& [name, child] : children) copy->children[name] = child->clone();
    return copy;
  }
};

std::vector<std::string> componentsOf(const std::string& path) {
  std::vector<std::string> parts;
  for (std::size_t at = 0; at < path.size();) {
    const std::size_t end = std::min(path.find('/', at), path.size());
    if (end > at) parts.push_back(path.substr(at, end - at));
    at = end + 1;
  }
  return parts;
}

class Model {
 public:
  enum class Mode { copy, move };
  Node root;

  Node* find(const std::string& path, bool followLast) { return walk(path, followLast, 0).node; }
  bool exists(const std::string& path) { return find(path, true) != nullptr; }
  bool isDirectory(const std::string& path) {
    const Node* node = find(path, true);
    return node != nullptr && node->kind == Kind::directory;
  }

  int copyOrMove(Mode mode, const std::string& source, const std::string& destination) {
    if (!exists(source)) return -1;
    if (!exists(destination)) return whole(mode, source, destination);
    std::string effective = destination;
    bool remove = true;
    if (isDirectory(destination)) {
      effective += "/" + componentsOf(source).back();
      remove = exists(effective) && !isDirectory(effective);
    } else if (isDirectory(source)) {
      return EEXIST;
    }
    if (remove) removeItem(effective);
    merge(mode, source, effective);
    return 0;
  }

 private:
  struct Walk {
    Node* node = nullptr;
    Node* parent = nullptr;
    std::string name;
    int error = ENOENT;
  };

  Walk walk(const std::string& path, bool followLast, int depth) {
    Walk at;
    if (depth > 20) return at;
    const std::vector<std::string> parts = componentsOf(path);
    Node* here = &root;
    for (std::size_t i = 0; i < parts.size(); ++i) {
      const bool last = i + 1 == parts.size();
      if (here->kind != Kind::directory) return {nullptr, nullptr, {}, ENOTDIR};
      at = {nullptr, here, parts[i], ENOENT};
      const auto child = here->children.find(parts[i]);
      if (child == here->children.end()) return last ? at : Walk{};
      Node* next = child->second.get();
      if (next->kind == Kind::link && (!last || followLast)) {
        next = walk(next->text, true, depth + 1).node;
        if (next == nullptr) return {};
      }
      here = next;
    }
    at.node = here;
    return at;
  }

  int whole(Mode mode, const std::string& source, const std::string& destination) {
    const Walk from = walk(source, false, 0);
    if (from.node == nullptr) return from.error;
    const Walk to = walk(destination, false, 0);
    if (to.parent == nullptr) return to.error;
    if (to.node != nullptr) return EEXIST;
    auto taken = from.node->clone();
    if (mode == Mode::move) from.parent->children.erase(from.name);
    to.parent->children[to.name] = std::move(taken);
    return 0;
  }

  void removeItem(const std::string& path) {
    const Walk at = walk(path, false, 0);
    if (at.node != nullptr) at.parent->children.erase(at.name);
  }

  void makeDirectories(const std::string& path) {
    std::string made;
    for (const std::string& part : componentsOf(path)) {
      made += "/" + part;
      const Walk at = walk(made, false, 0);
      if (at.node == nullptr && at.parent != nullptr) at.parent->children[at.name] = std::make_unique<Node>();
      if (!isDirectory(made)) return;
    }
  }

  void merge(Mode mode, const std::string& source, const std::string& destination) {
    if (whole(mode, source, destination) == 0) return;
    if (!exists(source) || isDirectory(source)) mergeBelow(mode, source, destination, "");
    const Walk at = walk(source, false, 0);
    if (at.node != nullptr && at.node->kind == Kind::directory && at.node->children.empty()) {
      at.parent->children.erase(at.name);
    }
  }

  void mergeBelow(Mode mode, const std::string& source, const std::string& destination,
                  const std::string& below) {
    const Node* directory = find(source + below, below.empty());
    if (directory == nullptr || directory->kind != Kind::directory) return;
    std::vector<std::string> names;
    for (const auto& [name, child] : directory->children) names.push_back(name);
    for (const std::string& name : names) {
      const std::string from = source + below + "/" + name;
      const std::string to = destination + below + "/" + name;
      // What is being filled is not taken along.
      const Node* item = find(from, false);
      if (item != nullptr && item == find(destination, true)) continue;
      if (exists(from) && exists(to) && !isDirectory(from) && !isDirectory(to)) removeItem(to);
      makeDirectories(to.substr(0, to.rfind('/')));
      (void)whole(mode, from, to);
      // Not one of the rules for items: below a link at the destination nothing is written.
      const Node* there = find(to, false);
      if (there != nullptr && there->kind == Kind::link) continue;
      mergeBelow(mode, source, destination, below + "/" + name);
    }
  }
};

class Trees {
 public:
  explicit Trees(unsigned seed) : random_(seed) {
    model_.root.children["src"] = tree(3);
    model_.root.children["dst"] = tree(3);
    auto out = std::make_unique<Node>();
    out->children["f"] = file();
    out->children["d"] = std::make_unique<Node>();
    out->children["d"]->children["a"] = file();
    model_.root.children["out"] = std::move(out);
    write(model_.root, disk_.path());
  }

  void step() {
    const bool forth = pick(2) == 0;
    const std::string source = somePath(forth ? "/src" : "/dst");
    const std::string destination = somePath(forth ? "/dst" : "/src");
    LinuxFileManager files;
    FileSystemManager manager(files);
    const std::string from = disk_.path() + source;
    const std::string to = disk_.path() + destination;
    const bool move = pick(2) == 0;
    const int expected = model_.copyOrMove(move ? Model::Mode::move : Model::Mode::copy, source, destination);
    const int actual = move ? manager.moveItem(from, to) : manager.copyItem(from, to);
    history_ += (move ? "move " : "copy ") + source + " to " + destination + "\n";
    ASSERT_EQ(actual, expected) << history_;
    std::map<std::string, std::string> modelled;
    std::map<std::string, std::string> found;
    list(model_.root, "", &modelled);
    listDisk("", &found);
    ASSERT_EQ(found, modelled) << history_;
  }

 private:
  unsigned pick(unsigned below) { return std::uniform_int_distribution<unsigned>(0, below - 1)(random_); }

  std::unique_ptr<Node> file() {
    auto made = std::make_unique<Node>();
    made->kind = Kind::file;
    made->text = "content " + std::to_string(++files_);
    return made;
  }

  std::unique_ptr<Node> tree(unsigned depth) {
    auto made = std::make_unique<Node>();
    for (const char* name : {"a", "b", "c", "d"}) {
      switch (pick(depth == 0 ? 6 : 9)) {
        case 0:
        case 1:
        case 2:
          made->children[name] = file();
          break;
        case 3: {
          auto link = std::make_unique<Node>();
          link->kind = Kind::link;
          link->text = std::vector<std::string>{"/out/f", "/out/d", "/nowhere"}[pick(3)];
          made->children[name] = std::move(link);
          break;
        }
        case 4:
        case 5:
          break;
        default:
          made->children[name] = tree(depth - 1);
      }
    }
    return made;
  }

  std::string somePath(const std::string& top) {
    std::string path = top;
    for (unsigned i = pick(4); i > 0; --i) path += std::string("/") + "abcd"[pick(4)];
    return path;
  }

  void write(const Node& node, const std::string& path) {
    for (const auto& [name, child] : node.children) {
      const std::string at = path + "/" + name;
      if (child->kind == Kind::file) {
        std::ofstream(at) << child->text;
      } else if (child->kind == Kind::link) {
        std::filesystem::create_symlink(disk_.path() + child->text, at);
      } else {
        std::filesystem::create_directory(at);
        write(*child, at);
      }
    }
  }

  void list(const Node& node, const std::string& path, std::map<std::string, std::string>* into) {
    for (const auto& [name, child] : node.children) {
      const std::string at = path + "/" + name;
      (*into)[at] = child->kind == Kind::file   ? "file " + child->text
                    : child->kind == Kind::link ? "link " + disk_.path() + child->text
                                                : "directory";
      list(*child, at, into);
    }
  }

  void listDisk(const std::string& path, std::map<std::string, std::string>* into) {
    for (const auto& entry : std::filesystem::directory_iterator(disk_.path() + path)) {
      const std::string at = path + "/" + entry.path().filename().string();
      if (entry.is_symlink()) {
        (*into)[at] = "link " + std::filesystem::read_symlink(entry.path()).string();
      } else if (entry.is_directory()) {
        (*into)[at] = "directory";
        listDisk(at, into);
      } else {
        (*into)[at] = "file " + contentOf(entry.path());
      }
    }
  }

  std::mt19937 random_;
  int files_ = 0;
  Model model_;
  // Thousands of small files: in memory where the system has such a place.
  TemporaryDirectory disk_{::access("/dev/shm", W_OK) == 0 ? std::filesystem::path("/dev/shm")
                                                           : std::filesystem::temp_directory_path()};
  std::string history_;
};

class CopyOrMoveProperty : public testing::TestWithParam<unsigned> {};

TEST_P(CopyOrMoveProperty, TheDiskAgreesWithTheModel) {
  for (unsigned round = 0; round < 20; ++round) {
    Trees trees(GetParam() * 1000 + round);
    for (int step = 0; step < 6; ++step) {
      trees.step();
      if (HasFatalFailure()) FAIL() << "seed " << GetParam() * 1000 + round;
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, CopyOrMoveProperty, testing::Range(1u, 16u));

}  // namespace
}  // namespace brenvik
