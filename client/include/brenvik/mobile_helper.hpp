// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#ifndef BRENVIK_MOBILE_HELPER_HPP
#define BRENVIK_MOBILE_HELPER_HPP

// The C library for C++20: objects that free themselves, and results that are a value or an error. Headers
// only; link with the C library. brenvik/mobile_helper.h describes each routine, its limits and its codes.
//
//   auto client = bvmh::Client::connect();
//   if (!client) return fail(client.error().text());
//   if (auto country = client->copyCountryCode()) std::puts(country->c_str());
//
// Only two things throw here: making a text (std::bad_alloc), and value() of a result without a value
// (NoValue).

#include <brenvik/mobile_helper.h>

#include <cerrno>
#include <chrono>
#include <climits>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <exception>
#include <initializer_list>
#include <memory>
#include <new>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <variant>
#include <version>

#if defined(__cpp_lib_expected) && __cpp_lib_expected >= 202202L
#include <expected>
#define BVMH_CPP_RESULTS stdexpected
#else
#define BVMH_CPP_RESULTS ownresult
#endif

namespace bvmh {
// Results are another type in a later C++; programs of both kinds may be linked into one.
inline namespace BVMH_CPP_RESULTS {

// A code of mobile_helper.h other than BVMH_OK.
class Error {
 public:
  explicit Error(std::int32_t code, int systemError = 0) noexcept : code_(code), systemError_(systemError) {}
  std::int32_t code() const noexcept { return code_; }
  // The errno behind BVMH_ERROR_SYSTEM, BVMH_ERROR_UNREACHABLE or a refusal by the kernel; else 0.
  int systemError() const noexcept { return systemError_; }
  const char* text() const noexcept { return bvmh_error_text(code_); }
  friend bool operator==(const Error&, const Error&) noexcept = default;

 private:
  std::int32_t code_;
  int systemError_;
};

#if defined(__cpp_lib_expected) && __cpp_lib_expected >= 202202L

template <class T>
using Result = std::expected<T, Error>;
using Failed = std::unexpected<Error>;

#else

struct Failed {
  explicit Failed(Error why) noexcept : error(why) {}
  Error error;
};

class NoValue : public std::exception {
 public:
  explicit NoValue(Error error) noexcept : error_(error) {}
  const char* what() const noexcept override { return error_.text(); }
  const Error& error() const noexcept { return error_; }

 private:
  Error error_;
};

// A value or an error: the part of std::expected that these calls need, with the same names.
template <class T>
class [[nodiscard]] Result {
 public:
  using value_type = T;
  using error_type = Error;

  template <class U = T>
  requires(std::is_constructible_v<T, U&&> && !std::is_same_v<std::remove_cvref_t<U>, Result> &&
           !std::is_same_v<std::remove_cvref_t<U>, Failed>) Result(U&& value)
      : content_(std::in_place_index<0>, std::forward<U>(value)) {}
  Result(Failed failed) noexcept : content_(std::in_place_index<1>, failed.error) {}

  bool has_value() const noexcept { return content_.index() == 0; }
  explicit operator bool() const noexcept { return has_value(); }
  // Precondition of these four: has_value().
  T& operator*() & noexcept { return *std::get_if<0>(&content_); }
  const T& operator*() const& noexcept { return *std::get_if<0>(&content_); }
  T&& operator*() && noexcept { return std::move(*std::get_if<0>(&content_)); }
  T* operator->() noexcept { return std::get_if<0>(&content_); }
  const T* operator->() const noexcept { return std::get_if<0>(&content_); }
  // Precondition: !has_value().
  const Error& error() const noexcept { return *std::get_if<1>(&content_); }

  // Throws NoValue if there is no value; built without exceptions, it ends the program.
  T& value() & { return has_value() ? **this : (refuse(), **this); }
  const T& value() const& { return has_value() ? **this : (refuse(), **this); }
  T&& value() && { return has_value() ? std::move(**this) : (refuse(), std::move(**this)); }
  template <class U>
  T value_or(U&& other) const& {
    return has_value() ? **this : static_cast<T>(std::forward<U>(other));
  }
  template <class U>
  T value_or(U&& other) && {
    return has_value() ? std::move(**this) : static_cast<T>(std::forward<U>(other));
  }

 private:
  [[noreturn]] void refuse() const {
#if defined(__cpp_exceptions)
    throw NoValue(error());
#else
    std::abort();
#endif
  }

  std::variant<T, Error> content_;
};

template <>
class [[nodiscard]] Result<void> {
 public:
  using value_type = void;
  using error_type = Error;

  Result() noexcept = default;
  Result(Failed failed) noexcept : error_(failed.error) {}

  bool has_value() const noexcept { return !error_.has_value(); }
  explicit operator bool() const noexcept { return has_value(); }
  // Precondition: !has_value().
  const Error& error() const noexcept { return *error_; }
  void value() const {
    if (has_value()) return;
#if defined(__cpp_exceptions)
    throw NoValue(*error_);
#else
    std::abort();
#endif
  }

 private:
  std::optional<Error> error_;
};

#endif

// A text argument: "...", a std::string, or anything with c_str() of chars, such as std::filesystem::path. It
// is not copied. A text with a NUL inside is BVMH_ERROR_INVALID_ARGUMENT.
class Text {
 public:
  Text(const char* text) noexcept : text_(text) {}
  Text(std::nullptr_t) = delete;
  template <class Holder>
  requires requires(const Holder& each) {
    { each.c_str() } -> std::same_as<const char*>;
  }
  Text(const Holder& holder) noexcept : text_(holder.c_str()) {
    if constexpr (requires { holder.size(); })
      isWhole(holder.size());
    else if constexpr (requires { holder.native().size(); })
      isWhole(holder.native().size());
  }
  // Null if the text cannot be sent.
  const char* get() const noexcept { return text_; }

 private:
  void isWhole(std::size_t size) noexcept {
    if (std::char_traits<char>::length(text_) != size) text_ = nullptr;
  }
  const char* text_;
};

// The bytes of a property list, as an argument; they are not copied.
class Bytes {
 public:
  template <class T, std::size_t extent>
  requires(sizeof(T) == 1) Bytes(std::span<T, extent> bytes)
  noexcept : bytes_(std::as_bytes(bytes)) {}
  Bytes(std::string_view text) noexcept : bytes_(std::as_bytes(std::span(text.data(), text.size()))) {}
  Bytes(const char* text) noexcept : Bytes(std::string_view(text)) {}
  template <class Container>
  requires requires(const Container& each) {
    { each.data() } -> std::convertible_to<const void*>;
    { each.size() } -> std::convertible_to<std::size_t>;
    requires sizeof(*each.data()) == 1;
  }
  Bytes(const Container& container) noexcept
      : bytes_(reinterpret_cast<const std::byte*>(container.data()), container.size()) {}
  const void* data() const noexcept { return bytes_.data(); }
  std::size_t size() const noexcept { return bytes_.size(); }

 private:
  std::span<const std::byte> bytes_;
};

// A region that a routine returned: an XML property list; empty if there is no value.
class Region {
 public:
  Region() noexcept = default;
  explicit Region(bvmh_region owned) noexcept : region_(owned) {}
  Region(Region&& other) noexcept : region_(std::exchange(other.region_, bvmh_region{})) {}
  Region& operator=(Region&& other) noexcept {
    if (this != &other) {
      bvmh_region_free(&region_);
      region_ = std::exchange(other.region_, bvmh_region{});
    }
    return *this;
  }
  ~Region() { bvmh_region_free(&region_); }

  bool empty() const noexcept { return region_.size == 0; }
  std::size_t size() const noexcept { return region_.size; }
  const std::byte* data() const noexcept { return static_cast<const std::byte*>(region_.bytes); }
  std::span<const std::byte> bytes() const noexcept { return {data(), size()}; }
  std::string_view text() const noexcept { return {static_cast<const char*>(region_.bytes), size()}; }

 private:
  bvmh_region region_{};
};

// A property list, the format of preferences, labels, files, pushes and notifications. Copies cost little,
// and later changes of one are not seen in another. A value that could not be made (no memory, or a text that
// is not UTF-8) has the type BVMH_VALUE_NONE; every operation with it fails.
class Value {
 public:
  Value() noexcept = default;
  explicit Value(bvmh_value* owned) noexcept : value_(owned) {}
  Value(const Value& other) noexcept : value_(bvmh_value_copy(other.value_)) {}
  Value(Value&& other) noexcept : value_(std::exchange(other.value_, nullptr)) {}
  Value& operator=(Value other) noexcept {
    std::swap(value_, other.value_);
    return *this;
  }
  ~Value() { bvmh_value_free(value_); }

  static Value boolean(bool value) noexcept { return Value(bvmh_value_new_boolean(value)); }
  static Value integer(std::int64_t value) noexcept { return Value(bvmh_value_new_integer(value)); }
  static Value unsignedInteger(std::uint64_t value) noexcept { return Value(bvmh_value_new_unsigned(value)); }
  static Value real(double value) noexcept { return Value(bvmh_value_new_real(value)); }
  static Value text(Text text) noexcept { return Value(bvmh_value_new_text(text.get())); }
  static Value data(Bytes bytes) noexcept { return Value(bvmh_value_new_data(bytes.data(), bytes.size())); }
  static Value date(std::chrono::system_clock::time_point when) noexcept {
    return Value(bvmh_value_new_date(std::chrono::duration<double>(when.time_since_epoch()).count()));
  }
  static Value array() noexcept { return Value(bvmh_value_new_array()); }
  static Value dictionary() noexcept { return Value(bvmh_value_new_dictionary()); }
  // Arrays of texts: labels and languages.
  static Value texts(std::initializer_list<Text> texts) noexcept {
    Value list = array();
    for (const Text& each : texts) {
      if (!list.append(text(each))) return Value();
    }
    return list;
  }

  // Append an element, or set the value under a key. mobile_helper.h lists their errors.
  Result<void> append(Value element) noexcept {
    return resultOf(bvmh_value_append(value_, std::exchange(element.value_, nullptr)));
  }
  Result<void> set(Text key, Value value) noexcept {
    return resultOf(bvmh_value_set(value_, key.get(), std::exchange(value.value_, nullptr)));
  }

  bvmh_value_type type() const noexcept { return bvmh_value_type_of(value_); }
  // The number of elements or entries; 0 for other types.
  std::size_t size() const noexcept { return bvmh_value_count(value_); }
  // An element, or the value of an entry, in order; BVMH_VALUE_NONE if there is none.
  Value at(std::size_t index) const noexcept { return Value(bvmh_value_at(value_, index)); }
  std::optional<std::string> keyAt(std::size_t index) const {
    return copied(bvmh_value_key_at(value_, index));
  }
  // The value under a key; BVMH_VALUE_NONE if there is none.
  Value find(Text key) const noexcept { return Value(bvmh_value_find(value_, key.get())); }

  // Return nothing if the value has another type, or does not fit.
  std::optional<bool> asBoolean() const noexcept { return got<bool>(bvmh_value_get_boolean); }
  std::optional<std::int64_t> asInteger() const noexcept { return got<std::int64_t>(bvmh_value_get_integer); }
  std::optional<std::uint64_t> asUnsigned() const noexcept {
    return got<std::uint64_t>(bvmh_value_get_unsigned);
  }
  std::optional<double> asReal() const noexcept { return got<double>(bvmh_value_get_real); }
  std::optional<std::string> asText() const {
    std::size_t length = 0;
    const char* text = bvmh_value_get_text(value_, &length);
    return text == nullptr ? std::nullopt : std::optional<std::string>(std::in_place, text, length);
  }
  // They live as long as the value.
  std::optional<std::span<const std::byte>> asData() const noexcept {
    std::size_t size = 0;
    const void* bytes = bvmh_value_get_data(value_, &size);
    if (bytes == nullptr) return std::nullopt;
    return std::span(static_cast<const std::byte*>(bytes), size);
  }
  std::optional<std::chrono::system_clock::time_point> asDate() const noexcept {
    const auto seconds = got<double>(bvmh_value_get_date);
    // No date if system_clock cannot hold it.
    if (!seconds || !(*seconds > -9.2e9 && *seconds < 9.2e9)) return std::nullopt;
    return std::chrono::system_clock::time_point(
        std::chrono::duration_cast<std::chrono::system_clock::duration>(
            std::chrono::duration<double>(*seconds)));
  }

  // XML or binary.
  static Result<Value> read(Bytes bytes) {
    bvmh_value* value = nullptr;
    const std::int32_t code = bvmh_value_read(bytes.data(), bytes.size(), &value);
    if (code != BVMH_OK) return Failed(Error(code));
    return Value(value);
  }
  // Writes the binary form, which every routine accepts.
  Result<Region> write() const {
    bvmh_region bytes{};
    const std::int32_t code = bvmh_value_write(value_, &bytes);
    if (code != BVMH_OK) return Failed(Error(code));
    return Region(bytes);
  }

  bvmh_value* get() const noexcept { return value_; }

 private:
  static Result<void> resultOf(std::int32_t code) noexcept {
    if (code != BVMH_OK) return Failed(Error(code));
    return {};
  }
  static std::optional<std::string> copied(const char* text) {
    return text == nullptr ? std::nullopt : std::optional<std::string>(text);
  }
  template <class T>
  std::optional<T> got(bool (*ask)(const bvmh_value*, T*)) const noexcept {
    T value{};
    return ask(value_, &value) ? std::optional<T>(value) : std::nullopt;
  }

  bvmh_value* value_ = nullptr;
};

// Reads the value in a region. BVMH_ERROR_NOT_A_VALUE for an empty region.
inline Result<Value> valueOf(const Region& region) { return Value::read(region.bytes()); }

// The outcome of a call that was begun.
class Outcome {
 public:
  explicit Outcome(bvmh_result owned) noexcept : result_(owned) {}
  Outcome(Outcome&& other) noexcept : result_(std::exchange(other.result_, bvmh_result{})) {}
  Outcome& operator=(Outcome&& other) noexcept {
    if (this != &other) {
      bvmh_result_free(&result_);
      result_ = std::exchange(other.result_, bvmh_result{});
    }
    return *this;
  }
  ~Outcome() { bvmh_result_free(&result_); }

  bvmh_call call() const noexcept { return result_.call; }
  void* context() const noexcept { return result_.context; }
  std::int32_t messageId() const noexcept { return result_.message_id; }
  // Success, or the reason why it failed.
  Result<void> done() const {
    if (result_.code != BVMH_OK) return Failed(Error(result_.code, result_.system_error));
    return {};
  }
  // The results of its routine; empty for other routines, and if it failed.
  bool boolean() const noexcept { return result_.boolean; }
  const char* text() const noexcept { return result_.text; }
  Region takeRegion() noexcept { return Region(std::exchange(result_.region, bvmh_region{})); }

 private:
  bvmh_result result_{};
};

// For Client::connect: where to find the helper, and how long a call may take in total.
struct Options {
  const char* socket = nullptr;          // for tests; null: the place compiled into the library
  std::chrono::milliseconds timeout{0};  // 0: BVMH_DEFAULT_TIMEOUT_MS
};

// A client that has checked in. One thread at a time. An object that was moved from can be assigned to or
// destroyed; its calls are BVMH_ERROR_INVALID_ARGUMENT.
class Client {
 public:
  static Result<Client> connect(const Options& options = {}) {
    Client client(bvmh_client_create());
    if (!client.client_) return Failed(Error(BVMH_ERROR_NO_MEMORY));
    client.setTimeout(options.timeout);
    std::int32_t code = BVMH_OK;
    if (options.socket != nullptr) code = bvmh_client_set_socket(client.get(), options.socket);
    if (code == BVMH_OK) code = bvmh_connect(client.get());
    if (code != BVMH_OK) return Failed(client.errorOf(code));
    return client;
  }

  void setTimeout(std::chrono::milliseconds timeout) noexcept {
    const auto count = timeout.count();
    bvmh_client_set_timeout(get(), count < 0                        ? 1
                                   : count > std::int64_t{UINT_MAX} ? UINT_MAX
                                                                    : static_cast<std::uint32_t>(count));
  }
  Result<void> reconnect() { return done(bvmh_reconnect(get())); }
  void disconnect() noexcept { bvmh_disconnect(get()); }
  // For functions of the C library that have no face here. Null after a move.
  bvmh_client* get() const noexcept { return client_.get(); }

  // ---- voicemail ----
  Result<void> setVoicemailToken(Text token) {
    return done(BVMobileHelperSetVoicemailToken(get(), token.get()));
  }
  Result<void> setVoicemailTokenForKey(Text key, Text token) {
    return done(BVMobileHelperSetVoicemailTokenForKey(get(), key.get(), token.get()));
  }
  Result<void> clearVoicemailToken() { return done(BVMobileHelperClearVoicemailToken(get())); }
  Result<void> resetVoicemailStore() { return done(BVMobileHelperResetVoicemailStore(get())); }
  Result<std::string> copyVoicemailTokenForKey(Text key) {
    char token[BVMH_TOKEN_SIZE];
    return text(BVMobileHelperCopyVoicemailTokenForKey(get(), key.get(), token, sizeof token), token);
  }
  Result<std::string> copyVoicemailToken() {
    char token[BVMH_TOKEN_SIZE];
    return text(BVMobileHelperCopyVoicemailToken(get(), token, sizeof token), token);
  }
  Result<bool> isVoicemailServiceSubscribed() {
    bool answer = false;
    const std::int32_t code = BVMobileHelperIsVoicemailServiceSubscribed(get(), &answer);
    return boolean(code, answer);
  }

  // ---- preferences ----
  Result<void> setPreferenceValue(Text domain, Text key, Bytes value) {
    return done(BVMobileHelperSetPreferenceValue(get(), domain.get(), key.get(), value.data(), value.size()));
  }
  Result<void> setPreferenceValue(Text domain, Text key, const Value& value) {
    const auto bytes = value.write();
    if (!bytes) return Failed(bytes.error());
    return setPreferenceValue(domain, key, Bytes(bytes->bytes()));
  }
  Result<void> removePreferenceValue(Text domain, Text key) {
    return done(BVMobileHelperSetPreferenceValue(get(), domain.get(), key.get(), "", 1));
  }
  Result<Region> copyPreferenceValue(Text domain, Text key) {
    bvmh_region value{};
    const std::int32_t code = BVMobileHelperCopyPreferenceValue(get(), domain.get(), key.get(), &value);
    return region(code, value);
  }
  Result<Region> copyAppPreferenceValue(Text domain, Text key) {
    bvmh_region value{};
    const std::int32_t code = BVMobileHelperCopyAppPreferenceValue(get(), domain.get(), key.get(), &value);
    return region(code, value);
  }
  Result<Region> loadPlistFile(Text path) {
    bvmh_region plist{};
    const std::int32_t code = BVMobileHelperLoadPlistFile(get(), path.get(), &plist);
    return region(code, plist);
  }

  // ---- carrier files; the last four tell whether the work succeeded ----
  Result<void> replaceCarrierSymlink(Text target, Text linkPath, Text domain) {
    return done(BVMobileHelperReplaceCarrierSymlink(get(), target.get(), linkPath.get(), domain.get()));
  }
  Result<void> createSymlink(Text target, Text linkPath) {
    return done(BVMobileHelperCreateSymlink(get(), target.get(), linkPath.get()));
  }
  Result<void> removeCarrierFile(Text path, Text domain) {
    return done(BVMobileHelperRemoveCarrierFile(get(), path.get(), domain.get()));
  }
  Result<bool> copyCarrierFile(Text sourceDirectory, Text destinationDirectory, Text fileName) {
    bool answer = false;
    const std::int32_t code = BVMobileHelperCopyCarrierFile(
        get(), sourceDirectory.get(), destinationDirectory.get(), fileName.get(), &answer);
    return boolean(code, answer);
  }
  Result<bool> copyCrashLogs(Text path) {
    bool answer = false;
    const std::int32_t code = BVMobileHelperCopyCrashLogs(get(), path.get(), &answer);
    return boolean(code, answer);
  }
  Result<bool> moveIntoCarrierBundles(Text sourcePath, Text destinationDirectory, Text name) {
    bool answer = false;
    const std::int32_t code = BVMobileHelperMoveIntoCarrierBundles(
        get(), sourcePath.get(), destinationDirectory.get(), name.get(), &answer);
    return boolean(code, answer);
  }
  Result<bool> unpackArchive(Text archivePath, Text destinationPath) {
    bool answer = false;
    const std::int32_t code =
        BVMobileHelperUnpackArchive(get(), archivePath.get(), destinationPath.get(), &answer);
    return boolean(code, answer);
  }

  // ---- location; the first two are answered by pushes, see Listener ----
  Result<void> requestCountryCodeFromLocation(double latitude, double longitude) {
    return done(BVMobileHelperRequestCountryCodeFromLocation(get(), latitude, longitude));
  }
  Result<void> requestWanIpFromLocation() { return done(BVMobileHelperRequestWanIPFromLocation(get())); }
  Result<std::string> copyCountryCode() {
    char country[BVMH_COUNTRY_CODE_SIZE];
    return text(BVMobileHelperCopyCountryCode(get(), country, sizeof country), country);
  }

  // ---- labels and contacts ----
  Result<Region> copyBadgeLabels(Bytes labels, Bytes languages) {
    bvmh_region names{};
    const std::int32_t code = BVMobileHelperCopyBadgeLabels(get(), labels.data(), labels.size(),
                                                            languages.data(), languages.size(), &names);
    return region(code, names);
  }
  Result<Region> copyLocalizedLabels(Bytes labels, Bytes languages) {
    bvmh_region names{};
    const std::int32_t code = BVMobileHelperCopyLocalizedLabels(get(), labels.data(), labels.size(),
                                                                languages.data(), languages.size(), &names);
    return region(code, names);
  }
  Result<Region> copyBadgeLabels(const Value& labels, const Value& languages) {
    const auto first = labels.write();
    const auto second = languages.write();
    if (!first || !second) return Failed(first ? second.error() : first.error());
    return copyBadgeLabels(Bytes(first->bytes()), Bytes(second->bytes()));
  }
  Result<Region> copyLocalizedLabels(const Value& labels, const Value& languages) {
    const auto first = labels.write();
    const auto second = languages.write();
    if (!first || !second) return Failed(first ? second.error() : first.error());
    return copyLocalizedLabels(Bytes(first->bytes()), Bytes(second->bytes()));
  }
  Result<bool> remapContactsChannel(Text from, Text to) {
    bool answer = false;
    const std::int32_t code = BVMobileHelperRemapContactsChannel(get(), from.get(), to.get(), &answer);
    return boolean(code, answer);
  }

  // ---- switches ----
  Result<void> cellularHeartbeat(bool on) { return done(BVMobileHelperCellularHeartbeat(get(), on ? 1 : 0)); }
  // Bits: BVMH_LASD_*.
  Result<void> checkLasdUpdate(std::int32_t databases) {
    return done(BVMobileHelperCheckLASDUpdate(get(), databases));
  }
  Result<void> enableRadioManagerLogs(bool on) {
    return done(BVMobileHelperEnableRadioManagerLogs(get(), on ? 1 : 0));
  }

  // ---- calls that do not block: begun here, and finished when take() hands out their outcome ----

  // A client that has not checked in, for beginConnect().
  static Result<Client> unconnected(const Options& options = {}) {
    Client client(bvmh_client_create());
    if (!client.client_) return Failed(Error(BVMH_ERROR_NO_MEMORY));
    client.setTimeout(options.timeout);
    if (options.socket == nullptr) return client;
    const std::int32_t code = bvmh_client_set_socket(client.get(), options.socket);
    if (code != BVMH_OK) return Failed(Error(code));
    return client;
  }
  // Readable when process() has something to do; -1 if it could not be made. The client owns it.
  int descriptor() noexcept { return bvmh_client_fd(get()); }
  void process() noexcept { (void)bvmh_process(get()); }
  // Takes the outcome of a call, or, for 0, of the call that finished first; nothing if there is none yet.
  Result<std::optional<Outcome>> take(bvmh_call call = 0) {
    bvmh_result result{};
    const std::int32_t code = bvmh_take_result(get(), call, &result);
    Outcome owned(result);
    if (code == BVMH_ERROR_IN_PROGRESS || (call == 0 && code == BVMH_ERROR_NO_SUCH_CALL))
      return std::optional<Outcome>();
    if (code != BVMH_OK) return Failed(Error(code));
    return std::optional<Outcome>(std::move(owned));
  }
  Result<void> cancel(bvmh_call call) { return done(bvmh_cancel(get(), call)); }
  // Makes the blocking call that is under way return BVMH_ERROR_INTERRUPTED. Any thread or signal handler may
  // call it.
  void interrupt() noexcept { bvmh_client_interrupt(get()); }
  Result<bvmh_call> beginConnect(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = bvmh_begin_connect(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginSetVoicemailToken(Text token, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperSetVoicemailTokenBegin(get(), token.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginSetVoicemailTokenForKey(Text key, Text token, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperSetVoicemailTokenForKeyBegin(get(), key.get(), token.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginClearVoicemailToken(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperClearVoicemailTokenBegin(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginResetVoicemailStore(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperResetVoicemailStoreBegin(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyVoicemailTokenForKey(Text key, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyVoicemailTokenForKeyBegin(get(), key.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyVoicemailToken(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyVoicemailTokenBegin(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginIsVoicemailServiceSubscribed(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperIsVoicemailServiceSubscribedBegin(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginSetPreferenceValue(Text domain, Text key, Bytes value, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperSetPreferenceValueBegin(
        get(), domain.get(), key.get(), value.data(), value.size(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyPreferenceValue(Text domain, Text key, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperCopyPreferenceValueBegin(get(), domain.get(), key.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyAppPreferenceValue(Text domain, Text key, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperCopyAppPreferenceValueBegin(get(), domain.get(), key.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginLoadPlistFile(Text path, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperLoadPlistFileBegin(get(), path.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginReplaceCarrierSymlink(Text target, Text linkPath, Text domain,
                                               void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperReplaceCarrierSymlinkBegin(get(), target.get(), linkPath.get(),
                                                                       domain.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCreateSymlink(Text target, Text linkPath, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperCreateSymlinkBegin(get(), target.get(), linkPath.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginRemoveCarrierFile(Text path, Text domain, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperRemoveCarrierFileBegin(get(), path.get(), domain.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyCarrierFile(Text sourceDirectory, Text destinationDirectory, Text fileName,
                                         void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyCarrierFileBegin(
        get(), sourceDirectory.get(), destinationDirectory.get(), fileName.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyCrashLogs(Text path, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyCrashLogsBegin(get(), path.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginMoveIntoCarrierBundles(Text sourcePath, Text destinationDirectory, Text name,
                                                void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperMoveIntoCarrierBundlesBegin(
        get(), sourcePath.get(), destinationDirectory.get(), name.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginUnpackArchive(Text archivePath, Text destinationPath, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperUnpackArchiveBegin(get(), archivePath.get(), destinationPath.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginRequestCountryCodeFromLocation(double latitude, double longitude,
                                                        void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperRequestCountryCodeFromLocationBegin(get(), latitude, longitude, context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginRequestWanIpFromLocation(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperRequestWanIPFromLocationBegin(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyCountryCode(void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyCountryCodeBegin(get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyBadgeLabels(Bytes labels, Bytes languages, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyBadgeLabelsBegin(
        get(), labels.data(), labels.size(), languages.data(), languages.size(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCopyLocalizedLabels(Bytes labels, Bytes languages, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCopyLocalizedLabelsBegin(
        get(), labels.data(), labels.size(), languages.data(), languages.size(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginRemapContactsChannel(Text from, Text to, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code =
        BVMobileHelperRemapContactsChannelBegin(get(), from.get(), to.get(), context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCellularHeartbeat(bool on, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCellularHeartbeatBegin(get(), on ? 1 : 0, context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginCheckLasdUpdate(std::int32_t databases, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperCheckLASDUpdateBegin(get(), databases, context, &call);
    return begun(code, call);
  }
  Result<bvmh_call> beginEnableRadioManagerLogs(bool on, void* context = nullptr) {
    bvmh_call call = 0;
    const std::int32_t code = BVMobileHelperEnableRadioManagerLogsBegin(get(), on ? 1 : 0, context, &call);
    return begun(code, call);
  }

 private:
  struct Free {
    void operator()(bvmh_client* client) const noexcept { bvmh_client_free(client); }
  };

  explicit Client(bvmh_client* owned) noexcept : client_(owned) {}
  Error errorOf(std::int32_t code) const noexcept { return Error(code, bvmh_client_errno(get())); }
  Result<void> done(std::int32_t code) const {
    if (code != BVMH_OK) return Failed(errorOf(code));
    return {};
  }
  Result<bvmh_call> begun(std::int32_t code, bvmh_call call) const {
    if (code != BVMH_OK) return Failed(errorOf(code));
    return call;
  }
  Result<bool> boolean(std::int32_t code, bool answer) const {
    if (code != BVMH_OK) return Failed(errorOf(code));
    return answer;
  }
  Result<std::string> text(std::int32_t code, const char* value) const {
    if (code != BVMH_OK) return Failed(errorOf(code));
    return std::string(value);
  }
  Result<Region> region(std::int32_t code, const bvmh_region& owned) const {
    Region value(owned);
    if (code != BVMH_OK) return Failed(errorOf(code));
    return value;
  }

  std::unique_ptr<bvmh_client, Free> client_;
};

// A push or a notification.
class Event {
 public:
  explicit Event(bvmh_event owned) noexcept : event_(owned) {}
  Event(Event&& other) noexcept : event_(std::exchange(other.event_, bvmh_event{})) {}
  Event& operator=(Event&& other) noexcept {
    if (this != &other) {
      bvmh_event_free(&event_);
      event_ = std::exchange(other.event_, bvmh_event{});
    }
    return *this;
  }
  ~Event() { bvmh_event_free(&event_); }

  bvmh_event_kind kind() const noexcept { return event_.kind; }
  bool wantsReply() const noexcept { return event_.wants_reply; }
  std::uint32_t senderUid() const noexcept { return event_.sender_uid; }
  std::int32_t senderPid() const noexcept { return event_.sender_pid; }
  // The dictionary, a binary property list, as it came: not yet checked.
  std::span<const std::byte> payload() const noexcept {
    return {static_cast<const std::byte*>(event_.payload.bytes), event_.payload.size};
  }
  Result<Value> values() const { return Value::read(payload()); }
  // The text under a key, for example "CountryCode"; nothing if the key is absent or its value is not a text.
  std::optional<std::string> text(Text key) const {
    const std::ptrdiff_t length = bvmh_event_text(&event_, key.get(), nullptr, 0);
    if (length < 0) return std::nullopt;
    std::string value(static_cast<std::size_t>(length), '\0');
    // With its NUL, which a std::string has room for.
    (void)bvmh_event_text(&event_, key.get(), value.data(), value.size() + 1);
    return value;
  }
  const bvmh_event* get() const noexcept { return &event_; }

 private:
  bvmh_event event_{};
};

// The telephony daemon's side: receives pushes and notifications. One thread at a time.
class Listener {
 public:
  static constexpr unsigned kEverything = BVMH_PUSHES | BVMH_NOTIFICATIONS;

  // Makes the sockets in the folder (null: that of named services, which only root may write).
  static Result<Listener> listen(const char* directory = nullptr, unsigned services = kEverything) {
    bvmh_listener* made = nullptr;
    const std::int32_t code = bvmh_listener_create(directory, services, &made);
    return taken(code, made);
  }
  // Takes over what the service manager handed to this process (LISTEN_FDS).
  static Result<Listener> fromEnvironment(unsigned services = kEverything) {
    bvmh_listener* made = nullptr;
    const std::int32_t code = bvmh_listener_create_from_environment(services, &made);
    return taken(code, made);
  }
  // Takes over listening sockets, -1 for none. On failure the caller still owns them.
  static Result<Listener> fromDescriptors(int pushes, int notifications) {
    bvmh_listener* made = nullptr;
    const std::int32_t code = bvmh_listener_create_from_fds(pushes, notifications, &made);
    return taken(code, made);
  }

  void allowUid(std::uint32_t uid) noexcept { bvmh_listener_allow_uid(get(), uid); }
  // Readable when next() has something to do.
  int descriptor() const noexcept { return bvmh_listener_fd(get()); }
  // The next event; nothing if none arrives in time. A negative time means for ever.
  Result<std::optional<Event>> next(std::chrono::milliseconds timeout = std::chrono::milliseconds(-1)) {
    const auto count = timeout.count();
    const int most = count < 0 ? -1 : count > INT_MAX ? INT_MAX : static_cast<int>(count);
    bvmh_event event{};
    const std::int32_t code = bvmh_listener_next(get(), most, &event);
    Event owned(event);
    if (code == BVMH_ERROR_TIMED_OUT) return std::optional<Event>();
    if (code != BVMH_OK) return Failed(Error(code, bvmh_listener_errno(get())));
    return std::optional<Event>(std::move(owned));
  }
  // Answers a push, within a second; code 0 is success.
  Result<void> reply(const Event& event, std::int32_t code = 0, std::int32_t domain = 0) {
    const std::int32_t sent = bvmh_listener_reply(get(), event.get(), domain, code);
    if (sent != BVMH_OK) return Failed(Error(sent, bvmh_listener_errno(get())));
    return {};
  }
  // For functions of the C library that have no face here. Null after a move.
  bvmh_listener* get() const noexcept { return listener_.get(); }

 private:
  struct Free {
    void operator()(bvmh_listener* listener) const noexcept { bvmh_listener_free(listener); }
  };

  explicit Listener(bvmh_listener* owned) noexcept : listener_(owned) {}
  static Result<Listener> taken(std::int32_t code, bvmh_listener* made) {
    if (code != BVMH_OK) return Failed(Error(code, code == BVMH_ERROR_SYSTEM ? errno : 0));
    return Listener(made);
  }

  std::unique_ptr<bvmh_listener, Free> listener_;
};

}  // namespace BVMH_CPP_RESULTS
}  // namespace bvmh

#endif
