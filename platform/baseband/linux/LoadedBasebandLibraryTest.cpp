// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/baseband/linux/LoadedBasebandLibrary.h"

#include <dlfcn.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/files/fakes/TemporaryDirectory.h"

namespace brenvik {
namespace {

std::string standin(const std::string& kind) {
  return std::string(BRENVIK_STANDIN_FOLDER) + "/baseband_standin_" + kind + ".so";
}

// Looks into a stand-in that is loaded already or will be; starts its record afresh.
class Inside {
 public:
  explicit Inside(const std::string& path) : library_(::dlopen(path.c_str(), RTLD_NOW)) {
    if (library_ == nullptr) return;
    calls_ = static_cast<char*>(::dlsym(library_, "BasebandStandinCalls"));
    busy_ = static_cast<int*>(::dlsym(library_, "BasebandStandinBusy"));
    std::memset(calls_, 0, 64);
    *busy_ = 0;
  }
  Inside(const Inside&) = delete;
  Inside& operator=(const Inside&) = delete;
  ~Inside() {
    if (library_ != nullptr) ::dlclose(library_);
  }
  bool isOpen() const { return library_ != nullptr; }
  std::string calls() const { return calls_; }
  void setBusy(int busy) { *busy_ = busy; }

 private:
  void* library_;
  char* calls_ = nullptr;
  int* busy_ = nullptr;
};

TEST(LoadedBasebandLibraryTest, HostsTheServerOfALibraryThatCanBeHosted) {
  Inside inside(standin("whole"));
  ASSERT_TRUE(inside.isOpen());
  LoadedBasebandLibrary library(standin("whole"));
  ASSERT_TRUE(library.canHost());
  auto server = library.create(nullptr);
  ASSERT_NE(server, nullptr);
  server->start();
  EXPECT_FALSE(server->isBusy());
  inside.setBusy(7);
  EXPECT_TRUE(server->isBusy());
  server->stop();
  EXPECT_EQ(inside.calls(), "?csbbx") << "an empty log server is passed as none";
  server.reset();
  EXPECT_EQ(inside.calls(), "?csbbxr");
}

TEST(LoadedBasebandLibraryTest, TheLastReferenceReleasesTheServerEvenAfterTheLibraryObjectIsGone) {
  Inside inside(standin("whole"));
  ASSERT_TRUE(inside.isOpen());
  std::shared_ptr<HostedBasebandServer> server;
  {
    LoadedBasebandLibrary library(standin("whole"));
    server = library.create(nullptr);
  }
  ASSERT_NE(server, nullptr);
  const auto second = server;
  server.reset();
  EXPECT_EQ(inside.calls(), "c");
  second->stop();
  EXPECT_EQ(inside.calls(), "cx");
}

TEST(LoadedBasebandLibraryTest, ALibraryIsFoundByItsNameInTheLoadersSearchPath) {
  Inside inside(standin("whole"));
  ASSERT_TRUE(inside.isOpen());
  LoadedBasebandLibrary library("baseband_standin_whole.so");
  EXPECT_TRUE(library.canHost());
  EXPECT_EQ(inside.calls(), "?");
}

// What canHost() says of a library in a folder that only the loader's cache names: 0 yes, 1 no, 77 when this
// process may have no cache of its own.
int hostsALibraryOfTheCache(const std::string& folder) {
  if (::unshare(::geteuid() == 0 ? CLONE_NEWNS : CLONE_NEWUSER | CLONE_NEWNS) != 0 ||
      ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      ::mount((folder + "/cache").c_str(), "/etc/ld.so.cache", nullptr, MS_BIND, nullptr) != 0) {
    return 77;
  }
  LoadedBasebandLibrary library("libbrenvik-known-to-the-cache.so");
  return library.canHost() ? 0 : 1;
}

TEST(LoadedBasebandLibraryTest, ALibraryThatOnlyTheLoadersCacheKnowsIsLoaded) {
  const TemporaryDirectory directory;
  const std::string folder = directory.path();
  std::filesystem::copy_file(standin("whole"), folder + "/libbrenvik-known-to-the-cache.so");
  std::ofstream(folder + "/conf") << folder << "\n";
  const std::string make =
      "PATH=$PATH:/usr/sbin:/sbin ldconfig -X -f " + folder + "/conf -C " + folder + "/cache";
  ASSERT_EQ(std::system(make.c_str()), 0);
  const pid_t child = ::fork();
  if (child == 0) std::_Exit(hostsALibraryOfTheCache(folder));
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  if (WEXITSTATUS(status) == 77) GTEST_SKIP() << "no mounts of its own";
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST(LoadedBasebandLibraryTest, ALibraryWithoutTheFunctionsIsLoadedAndCannotHost) {
  const char* const name = "libanl.so.1";  // belongs to the C library; nothing here uses it
  ASSERT_EQ(::dlopen(name, RTLD_NOW | RTLD_NOLOAD), nullptr);
  LoadedBasebandLibrary library(name);
  EXPECT_FALSE(library.canHost());
  EXPECT_NE(::dlopen(name, RTLD_NOW | RTLD_NOLOAD), nullptr) << "it was looked into";
}

TEST(LoadedBasebandLibraryTest, ALibraryThatSaysItCannotHostIsNotHosted) {
  LoadedBasebandLibrary library(standin("cannot_host"));
  EXPECT_FALSE(library.canHost());
}

TEST(LoadedBasebandLibraryTest, ALibraryThatMakesNoServerGivesAnEmptyOneAndReleasesNothing) {
  Inside inside(standin("makes_nothing"));
  ASSERT_TRUE(inside.isOpen());
  LoadedBasebandLibrary library(standin("makes_nothing"));
  ASSERT_TRUE(library.canHost());
  EXPECT_EQ(library.create(nullptr), nullptr);
  EXPECT_EQ(inside.calls(), "?c");
}

TEST(LoadedBasebandLibraryTest, AMissingLibraryCannotHostAndMakesNothing) {
  LoadedBasebandLibrary library("libbrenvik-there-is-no-such-library.so.0");
  EXPECT_FALSE(library.canHost());
  EXPECT_FALSE(library.canHost());
  EXPECT_EQ(library.create(nullptr), nullptr);
}

TEST(LoadedBasebandLibraryTest, ALibraryWithoutTheCanHostFunctionCannotHost) {
  Inside inside(standin("without_can_host"));
  ASSERT_TRUE(inside.isOpen());
  LoadedBasebandLibrary library(standin("without_can_host"));
  EXPECT_FALSE(library.canHost());
  EXPECT_EQ(library.create(nullptr), nullptr);
  EXPECT_EQ(inside.calls(), "");
}

TEST(LoadedBasebandLibraryTest, ALibraryThatCouldNotBeStoppedIsNeverAsked) {
  Inside inside(standin("without_stop"));
  ASSERT_TRUE(inside.isOpen());
  LoadedBasebandLibrary library(standin("without_stop"));
  EXPECT_FALSE(library.canHost());
  EXPECT_EQ(inside.calls(), "");
}

TEST(LoadedBasebandLibraryTest, AnEmptyNameIsNoLibraryAndNotThisProgram) {
  LoadedBasebandLibrary library("");
  EXPECT_FALSE(library.canHost());
}

TEST(LoadedBasebandLibraryTest, TheLibraryIsLoadedWhenItIsFirstAskedAboutAndNotBefore) {
  // No other test touches this one: what is loaded once stays loaded.
  const std::string path = standin("loaded_late");
  LoadedBasebandLibrary library(path);
  EXPECT_EQ(::dlopen(path.c_str(), RTLD_NOW | RTLD_NOLOAD), nullptr);
  EXPECT_TRUE(library.canHost());
  EXPECT_NE(::dlopen(path.c_str(), RTLD_NOW | RTLD_NOLOAD), nullptr);
}

}  // namespace
}  // namespace brenvik
