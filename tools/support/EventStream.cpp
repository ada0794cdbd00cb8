// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/EventStream.h"

#include <poll.h>
#include <sys/signalfd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <memory>
#include <nlohmann/json.hpp>
#include <span>

#include "platform/base/UniqueFd.h"
#include "platform/plist/PropertyListCodec.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

struct FreeListener {
  void operator()(bvmh_listener* listener) const { bvmh_listener_free(listener); }
};

// Interrupts as input, so that the socket files are removed on the way out.
UniqueFd endingSignals() {
  sigset_t signals;
  ::sigemptyset(&signals);
  ::sigaddset(&signals, SIGINT);
  ::sigaddset(&signals, SIGTERM);
  if (::sigprocmask(SIG_BLOCK, &signals, nullptr) != 0) return UniqueFd();
  return UniqueFd(::signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
}

const char* nameOf(bvmh_event_kind kind) {
  switch (kind) {
    case BVMH_EVENT_CIVIC_INFO:
      return "civic-info";
    case BVMH_EVENT_LOCAL_ADDRESS:
      return "local-address";
    case BVMH_EVENT_NOTIFICATION:
      return "notification";
    case BVMH_EVENT_NONE:
      break;
  }
  return "unknown";
}

// Answers a push as the options say, and tells what became of that.
std::string answer(bvmh_listener* listener, const bvmh_event& event, const EventStreamOptions& options) {
  if (!event.wants_reply || !options.answers) return "none";
  if (bvmh_listener_reply(listener, &event, 0, options.errorCode) != BVMH_OK)
    return "none, the sender has gone";
  return options.errorCode == 0 ? "success" : "refused with " + std::to_string(options.errorCode);
}

int cannotListen(const EventStreamOptions& options, std::int32_t code, int error) {
  const std::string reason = code == BVMH_ERROR_SYSTEM ? std::strerror(error) : bvmh_error_text(code);
  std::fprintf(stderr, "%s: cannot listen in %s: %s\n", options.program.c_str(), options.directory.c_str(),
               reason.c_str());
  return 2;
}

}  // namespace

std::string eventLine(const bvmh_event& event, const std::string& answer, bool asJson) {
  const PropertyList values =
      parsePropertyList({static_cast<const std::byte*>(event.payload.bytes), event.payload.size});
  if (asJson) {
    nlohmann::ordered_json line{{"event", nameOf(event.kind)}};
    if (values) {
      line["values"] = jsonOf(values);
    } else {
      line["error"] = "not a property list";
      line["size"] = event.payload.size;
    }
    line["sender"] = {{"uid", event.sender_uid}, {"pid", event.sender_pid}};
    line["answer"] = answer;
    return jsonLine(line);
  }
  std::string line = nameOf(event.kind);
  if (!values.is(PropertyList::Type::dictionary)) {
    return line + ": the payload of " + std::to_string(event.payload.size) + " bytes is no dictionary";
  }
  for (std::size_t i = 0; i < values.size(); ++i) {
    const PropertyList value = values.at(i);
    line += ' ' + printable(values.keyAt(i)) + '=';
    if (value.is(PropertyList::Type::array)) {
      for (std::size_t j = 0; j < value.size(); ++j) line += (j == 0 ? "" : ",") + humanText(value.at(j));
    } else {
      line += value.is(PropertyList::Type::string) ? '"' + humanText(value) + '"' : humanText(value);
    }
  }
  if (event.wants_reply) line += " (answer: " + answer + ")";
  return line;
}

int printEvents(const EventStreamOptions& given) {
  EventStreamOptions options = given;
  const UniqueFd signals = endingSignals();
  if (!signals.isValid()) return cannotListen(options, BVMH_ERROR_SYSTEM, errno);

  constexpr unsigned kBoth = BVMH_PUSHES | BVMH_NOTIFICATIONS;
  bvmh_listener* made = nullptr;
  // Sockets that a service manager handed over come first, unless a folder was asked for.
  std::int32_t created = BVMH_ERROR_NOT_HANDED_OVER;
  if (options.directory.empty()) {
    created = bvmh_listener_create_from_environment(kBoth, &made);
    options.directory = created == BVMH_ERROR_NOT_HANDED_OVER ? bvmh_bootstrap_directory()
                                                              : "the sockets of the service manager";
  }
  const bool isHandedOver = created != BVMH_ERROR_NOT_HANDED_OVER;
  if (!isHandedOver) {
    created = bvmh_listener_create(options.directory.c_str(), kBoth, &made);
  }
  const std::unique_ptr<bvmh_listener, FreeListener> listener(made);
  if (created != BVMH_OK) return cannotListen(options, created, errno);
  if (options.helperUid) bvmh_listener_allow_uid(listener.get(), *options.helperUid);
  std::fprintf(stderr, "%s: listening %s %s\n", options.program.c_str(), isHandedOver ? "on" : "in",
               options.directory.c_str());

  for (std::uint64_t count = 0; !options.most || count < *options.most;) {
    std::array inputs{pollfd{bvmh_listener_fd(listener.get()), POLLIN, 0}, pollfd{signals.get(), POLLIN, 0}};
    if (::poll(inputs.data(), inputs.size(), -1) < 0 && errno != EINTR) {
      return cannotListen(options, BVMH_ERROR_SYSTEM, errno);
    }
    if (inputs[1].revents != 0) break;
    bvmh_event event{};
    const std::int32_t code = bvmh_listener_next(listener.get(), 0, &event);
    if (code == BVMH_ERROR_TIMED_OUT) continue;
    if (code != BVMH_OK) return cannotListen(options, code, bvmh_listener_errno(listener.get()));
    ++count;
    const std::string answered = answer(listener.get(), event, options);
    std::printf("%s\n", eventLine(event, answered, options.asJson).c_str());
    std::fflush(stdout);
    bvmh_event_free(&event);
  }
  return 0;
}

}  // namespace brenvik::tools
