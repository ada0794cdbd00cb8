// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "helper/preferences/PreferenceTransfer.h"

#include <cstddef>
#include <new>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/base/Utf8.h"
#include "platform/log/Log.h"
#include "platform/plist/PropertyListCodec.h"

namespace brenvik {
namespace {

constexpr std::size_t kFieldSize = 256;

std::string_view terminated(char* field) noexcept {
  field[kFieldSize - 1] = '\0';
  return textOfField(field, kFieldSize);
}

std::optional<std::string_view> utf8In(char* field) noexcept {
  const std::string_view text = terminated(field);
  return isValidUtf8(text) ? std::optional(text) : std::nullopt;
}

}  // namespace

KernelReturn PreferenceTransfer::setPreferenceValue(PortName /*port*/, char* domain, char* key,
                                                    const void* valueBytes,
                                                    std::uint32_t valueLength) noexcept try {
  const auto domainText = utf8In(domain);
  const auto keyText = utf8In(key);
  if (!domainText || !keyText) return kern::failure;
  PropertyList value;
  // One byte asks for removal and is not looked at; no property list is that short.
  if (valueLength != 1) {
    if (valueBytes == nullptr) return kern::failure;
    value = parsePropertyList({static_cast<const std::byte*>(valueBytes), valueLength});
    if (!value) return kern::failure;
  }
  preferences_.setValue(*keyText, value, *domainText, UserScope::currentUser, HostScope::anyHost);
  // The status does not tell whether the disk took it; the store's own error line does.
  (void)preferences_.synchronize(*domainText, UserScope::currentUser, HostScope::anyHost);
  return kern::success;
} catch (const std::bad_alloc&) {
  return kern::failure;
}

KernelReturn PreferenceTransfer::copyPreferenceValue(PortName /*port*/, char* domain, char* key,
                                                     OutOfLinePayload* payload) noexcept {
  return copyValue(Scope::currentUser, domain, key, payload);
}

KernelReturn PreferenceTransfer::copyAppPreferenceValue(PortName /*port*/, char* domain, char* key,
                                                        OutOfLinePayload* payload) noexcept {
  return copyValue(Scope::application, domain, key, payload);
}

KernelReturn PreferenceTransfer::copyValue(Scope scope, char* domain, char* key,
                                           OutOfLinePayload* payload) noexcept try {
  *payload = {};
  const auto domainText = utf8In(domain);
  const auto keyText = utf8In(key);
  if (!domainText || !keyText) return kern::failure;

  // First see what other processes have written. Nothing of ours is waiting to be stored, so the result does
  // not matter: what cannot be read has no value.
  PropertyList value;
  if (scope == Scope::application) {
    (void)preferences_.synchronizeApplication(*domainText);
    value = preferences_.copyApplicationValue(*keyText, *domainText);
  } else {
    (void)preferences_.synchronize(*domainText, UserScope::currentUser, HostScope::anyHost);
    value = preferences_.copyValue(*keyText, *domainText, UserScope::currentUser, HostScope::anyHost);
  }
  if (!value) return kern::success;

  const auto bytes = serializePropertyList(value, PropertyListFormat::xml);
  if (!bytes || bytes->empty()) return kern::failure;
  const KernelReturn code = fillPayload(regions_, *bytes, payload);
  if (scope == Scope::application) {
    logBsd(SyslogPriority::error, "VM_ALLOCATE %ul (mhs2)\n", payload->length);
  } else {
    logBsd(SyslogPriority::error, "VM_ALLOCATE %ul (mhs1)\n", payload->length);
  }
  return code;
} catch (const std::bad_alloc&) {
  return kern::failure;
}

KernelReturn PreferenceTransfer::loadPlistFile(PortName /*port*/, char* path,
                                               OutOfLinePayload* payload) noexcept {
  *payload = {};
  (void)terminated(path);
  logUnified(LogLevel::info, "Loading %s as plist", path);
  std::optional<std::string> bytes;
  try {
    bytes = serializePropertyList(readDictionary_(path), PropertyListFormat::xml);
  } catch (const std::bad_alloc&) {
    // It gave nothing, as the line and the status say.
  }
  if (!bytes) {
    logUnified(LogLevel::error, "Could not create data representation of dictionary");
    return kern::memoryFailure;
  }
  const KernelReturn code = fillPayload(regions_, *bytes, payload);
  if (code != kern::success) {
    logUnified(LogLevel::error, "Could not allocate %d bytes for payload", static_cast<int>(payload->length));
  }
  return code;
}

}  // namespace brenvik
