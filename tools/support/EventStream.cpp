// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/support/EventStream.h"

#include <poll.h>
#include <sys/signalfd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <nlohmann/json.hpp>
#include <span>

#include "platform/plist/PropertyListCodec.h"
#include "tools/support/Output.h"
#include "tools/support/PropertyListText.h"

namespace brenvik::tools {
namespace {

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
std::string answer(StandIn& standIn, const bvmh_event& event, const EventStreamOptions& options) {
  if (!event.wants_reply || !options.answers) return "none";
  if (!standIn.answer(event, options.errorCode)) return "none, the sender has gone";
  return options.errorCode == 0 ? "success" : "refused with " + std::to_string(options.errorCode);
}

ExitStatus cannotListen(const EventStreamOptions& options, const StandIn& standIn) {
  printFailure(options.program, options.asJson, "cannot listen " + standIn.place() + ": " + standIn.reason(),
               standIn.advice(), nlohmann::ordered_json::object());
  return ExitStatus::failed;
}

}  // namespace

Patience::Patience(std::optional<double> seconds) {
  if (seconds) end_ = Clock::now() + std::chrono::milliseconds(static_cast<std::int64_t>(*seconds * 1000));
}

int Patience::milliseconds(int most) const {
  if (!end_) return -1;
  // Rounded up, so that the time is over when poll returns.
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(*end_ - Clock::now()).count();
  return static_cast<int>(std::clamp<std::int64_t>(left, 0, most));
}

StandIn::~StandIn() { bvmh_listener_free(listener_); }

bool StandIn::fail(std::int32_t code, int error) {
  reason_ = code == BVMH_ERROR_SYSTEM ? std::strerror(error) : bvmh_error_text(code);
  return false;
}

bool StandIn::listen(const std::string& directory, unsigned services,
                     std::optional<std::uint32_t> helperUid) {
  const std::string folder = directory.empty() ? bvmh_bootstrap_directory() : directory;
  place_ = "in " + printable(folder);
  signals_ = endingSignals();
  if (!signals_.isValid()) return fail(BVMH_ERROR_SYSTEM, errno);
  // Sockets that a service manager handed over come first, unless a folder was asked for.
  std::int32_t created = BVMH_ERROR_NOT_HANDED_OVER;
  if (directory.empty()) created = bvmh_listener_create_from_environment(services, &listener_);
  if (created == BVMH_ERROR_NOT_HANDED_OVER) {
    created = bvmh_listener_create(folder.c_str(), services, &listener_);
  } else {
    place_ = "on the sockets of the service manager";
  }
  if (created != BVMH_OK) {
    const int error = errno;
    if (created == BVMH_ERROR_NAME_IN_USE) {
      advice_ = "The telephony daemon listens there, or another program in its place: stop that one first.";
    } else if (created == BVMH_ERROR_SYSTEM && (error == EACCES || error == EPERM)) {
      advice_ =
          "The folder is root's. Run this as root, have a service manager hand the sockets over, or name "
          "another "
          "folder with --directory.";
    }
    return fail(created, error);
  }
  if (helperUid) bvmh_listener_allow_uid(listener_, *helperUid);
  return true;
}

bool StandIn::answer(const bvmh_event& event, std::int32_t errorCode) {
  return bvmh_listener_reply(listener_, &event, 0, errorCode) == BVMH_OK;
}

StandIn::Came StandIn::next(int milliseconds, bvmh_event* event) {
  std::array inputs{pollfd{bvmh_listener_fd(listener_), POLLIN, 0}, pollfd{signals_.get(), POLLIN, 0}};
  const int ready = ::poll(inputs.data(), inputs.size(), milliseconds);
  if (ready < 0 && errno != EINTR) {
    (void)fail(BVMH_ERROR_SYSTEM, errno);
    return Came::failure;
  }
  if (inputs[1].revents != 0) return Came::interrupt;
  if (ready <= 0) return Came::nothing;
  const std::int32_t code = bvmh_listener_next(listener_, 0, event);
  if (code == BVMH_OK) return Came::event;
  if (code == BVMH_ERROR_TIMED_OUT) return Came::nothing;
  (void)fail(code, bvmh_listener_errno(listener_));
  return Came::failure;
}

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

void printFailure(const std::string& program, bool asJson, const std::string& message,
                  const std::string& advice, const nlohmann::ordered_json& fields) {
  if (asJson) {
    nlohmann::ordered_json line{{"ok", false}};
    line.update(fields);
    line["error"] = message;
    if (!advice.empty()) line["advice"] = advice;
    (void)printOut(jsonLine(line) + '\n');  // a loss is told at the end
    return;
  }
  std::fprintf(stderr, "%s %s\n", styled(Look::bad, program + ":", Stream::error).c_str(), message.c_str());
  if (!advice.empty()) std::fprintf(stderr, "%s\n", advice.c_str());
}

ExitStatus printEvents(const EventStreamOptions& options) {
  StandIn standIn;
  if (!standIn.listen(options.directory, BVMH_PUSHES | BVMH_NOTIFICATIONS, options.helperUid)) {
    return cannotListen(options, standIn);
  }
  std::fprintf(stderr, "%s: listening %s\n", options.program.c_str(), standIn.place().c_str());

  const Patience patience(options.seconds);
  for (std::uint64_t count = 0; !options.most || count < *options.most;) {
    bvmh_event event{};
    const StandIn::Came came = standIn.next(patience.milliseconds(), &event);
    if (came == StandIn::Came::interrupt) break;
    if (came == StandIn::Came::failure) return cannotListen(options, standIn);
    if (came == StandIn::Came::nothing) {
      if (!patience.isOver()) continue;
      if (!options.most) break;
      printFailure(options.program, options.asJson,
                   std::to_string(count) + " of " + std::to_string(*options.most) + " arrived in time", "",
                   nlohmann::ordered_json::object());
      return ExitStatus::timedOut;
    }
    ++count;
    const std::string answered = answer(standIn, event, options);
    const bool isPrinted = printOut(eventLine(event, answered, options.asJson) + '\n') && flushOutput();
    bvmh_event_free(&event);
    if (!isPrinted) break;  // nobody reads any more; finishOutput says so
  }
  return ExitStatus::done;
}

}  // namespace brenvik::tools
