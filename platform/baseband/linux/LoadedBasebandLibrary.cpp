// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/baseband/linux/LoadedBasebandLibrary.h"

#include <dlfcn.h>

#include <new>
#include <type_traits>
#include <utility>

#include "platform/baseband/linux/BasebandAbi.h"

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

bool LoadedBasebandLibrary::load() noexcept {
  if (std::exchange(tried_, true)) return loaded_;
  // An empty name would open this program itself.
  if (name_.empty()) return false;
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
