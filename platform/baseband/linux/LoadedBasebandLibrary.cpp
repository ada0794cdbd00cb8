// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/baseband/linux/LoadedBasebandLibrary.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstddef>
#include <memory>
#include <new>
#include <type_traits>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/baseband/linux/BasebandAbi.h"
#include "platform/baseband/linux/LoaderCache.h"

namespace brenvik {
namespace {

// The header that libraries are written against and the pointers used here must say the same.
template <auto function, typename Pointer>
constexpr bool kSameFunction = std::is_same_v<std::remove_const_t<decltype(function)>, Pointer>;

template <typename Pointer>
bool find(void* library, const char* name, Pointer* function) noexcept {
  *function = reinterpret_cast<Pointer>(::dlsym(library, name));
  return *function != nullptr;
}

// A failed dlopen costs some 90 system calls (170 us measured, at every start): the loader tries every
// processor variant of every folder. The library is absent on most systems, so the same places are looked
// into first, at a tenth of that: the loader's search path and its cache. A wrong "yes" only costs the
// dlopen.
bool isInSearchPath(const std::string& name) {
  struct Closer {
    void operator()(void* library) const noexcept { ::dlclose(library); }
  };
  const std::unique_ptr<void, Closer> program(::dlopen(nullptr, RTLD_NOW));
  Dl_serinfo size{};
  if (program == nullptr || ::dlinfo(program.get(), RTLD_DI_SERINFOSIZE, &size) != 0) return true;
  const auto memory = std::make_unique<std::max_align_t[]>(size.dls_size / sizeof(std::max_align_t) + 1);
  auto* const path = reinterpret_cast<Dl_serinfo*>(memory.get());
  path->dls_size = size.dls_size;
  path->dls_cnt = size.dls_cnt;
  if (::dlinfo(program.get(), RTLD_DI_SERINFO, path) != 0) return true;
  std::string candidate;
  for (unsigned i = 0; i < path->dls_cnt; ++i) {
    candidate.assign(path->dls_serpath[i].dls_name).append("/").append(name);
    if (::access(candidate.c_str(), F_OK) == 0) return true;
  }
  return false;
}

bool isInLoaderCache(const std::string& name) noexcept {
  const UniqueFd file(::open("/etc/ld.so.cache", O_RDONLY | O_CLOEXEC));
  struct stat facts {};
  if (!file.isValid() || ::fstat(file.get(), &facts) != 0 || facts.st_size <= 0) return false;
  const auto size = static_cast<std::size_t>(facts.st_size);
  void* const cache = ::mmap(nullptr, size, PROT_READ, MAP_PRIVATE, file.get(), 0);
  if (cache == MAP_FAILED) return true;
  const bool found = mayBeInLoaderCache({static_cast<const std::byte*>(cache), size}, name);
  ::munmap(cache, size);
  return found;
}

bool isWorthLoading(const std::string& name) {
  return name.find('/') != std::string::npos || isInSearchPath(name) || isInLoaderCache(name);
}

}  // namespace

class LoadedBasebandLibrary::Server final : public HostedBasebandServer {
 public:
  Server(const Functions& functions, std::shared_ptr<BasebandLogServer> logServer) noexcept
      : functions_(functions),
        logServer_(std::move(logServer)),
        handle_(functions_.create(static_cast<void*>(logServer_.get()))) {}
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;
  ~Server() override {
    if (handle_ != nullptr) functions_.release(handle_);
  }

  bool exists() const noexcept { return handle_ != nullptr; }
  void start() override { functions_.start(handle_); }
  bool isBusy() override { return functions_.isBusy(handle_) != 0; }
  void stop() override { functions_.stop(handle_); }

 private:
  const Functions functions_;
  const std::shared_ptr<BasebandLogServer> logServer_;
  void* const handle_;
};

LoadedBasebandLibrary::LoadedBasebandLibrary() : LoadedBasebandLibrary(BRENVIK_BASEBAND_LIBRARY) {}

LoadedBasebandLibrary::LoadedBasebandLibrary(std::string name) : name_(std::move(name)) {}

bool LoadedBasebandLibrary::load() noexcept try {
  if (std::exchange(tried_, true)) return loaded_;
  // An empty name would open this program itself.
  if (name_.empty() || !isWorthLoading(name_)) return false;
  // Never closed: a library that has run threads or registered exit handlers cannot be unmapped safely.
  void* const library = ::dlopen(name_.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (library == nullptr) return false;
  static_assert(kSameFunction<&BrenvikBasebandCanHost, decltype(Functions::canHost)> &&
                kSameFunction<&BrenvikBasebandServerCreate, decltype(Functions::create)> &&
                kSameFunction<&BrenvikBasebandServerStart, decltype(Functions::start)> &&
                kSameFunction<&BrenvikBasebandServerIsBusy, decltype(Functions::isBusy)> &&
                kSameFunction<&BrenvikBasebandServerStop, decltype(Functions::stop)> &&
                kSameFunction<&BrenvikBasebandServerRelease, decltype(Functions::release)>);
  loaded_ = find(library, "BrenvikBasebandCanHost", &functions_.canHost) &&
            find(library, "BrenvikBasebandServerCreate", &functions_.create) &&
            find(library, "BrenvikBasebandServerStart", &functions_.start) &&
            find(library, "BrenvikBasebandServerIsBusy", &functions_.isBusy) &&
            find(library, "BrenvikBasebandServerStop", &functions_.stop) &&
            find(library, "BrenvikBasebandServerRelease", &functions_.release);
  return loaded_;
} catch (const std::bad_alloc&) {
  return false;
}

bool LoadedBasebandLibrary::canHost() noexcept { return load() && functions_.canHost() != 0; }

std::shared_ptr<HostedBasebandServer> LoadedBasebandLibrary::create(
    std::shared_ptr<BasebandLogServer> logServer) noexcept try {
  if (!load()) return nullptr;
  auto server = std::make_shared<Server>(functions_, std::move(logServer));
  if (!server->exists()) return nullptr;
  return server;
} catch (const std::bad_alloc&) {
  return nullptr;
}

}  // namespace brenvik
