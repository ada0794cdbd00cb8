// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace brenvik::tools {

// How a program of ours ends. Scripts rely on the numbers: they are never given another meaning.
//
//   0  done           the work is done, and everything was printed
//   1  failed         the helper could not do it, or this program could not
//   2  usage          the command line is wrong; nobody was asked
//   3  no value       the helper was asked and has no such value
//   4  refused        the helper refuses this program, or does not touch that path
//   5  unreachable    there is no helper, or it left before it took the request
//   6  timed out      no answer in time; the work may still be done
//   7  protocol       the two do not understand each other, or no answer came to what may have been done
//   8  output lost    the work is done, but not everything could be printed
enum class ExitStatus : std::uint8_t {
  done = 0,
  failed = 1,
  usage = 2,
  noValue = 3,
  refused = 4,
  unreachable = 5,
  timedOut = 6,
  protocol = 7,
  outputLost = 8,
};

struct ExitStatusFacts {
  ExitStatus status;
  const char* name;          // a word or two, for the last line of the help
  const char* meaning;       // a sentence or more, for the manual page
  bool isOfRequest = false;  // only a program that asks the helper can end so
};

inline constexpr std::array kExitStatuses{
    ExitStatusFacts{ExitStatus::done, "done", "Done, and everything was printed."},
    ExitStatusFacts{
        ExitStatus::failed, "failed",
        "The helper could not do it, or this program could not. Where the helper only answers that "
        "its work failed, the message points to its log."},
    ExitStatusFacts{ExitStatus::usage, "wrong usage", "Wrong usage. Nobody was asked."},
    ExitStatusFacts{
        ExitStatus::noValue, "no such value",
        "The helper was asked, and there is no such value: no preference, no token, no country, no "
        "address.",
        true},
    ExitStatusFacts{ExitStatus::refused, "refused",
                    "Refused: this program lacks the entitlement or may not connect, or the helper does not "
                    "touch that path.",
                    true},
    ExitStatusFacts{ExitStatus::unreachable, "no helper",
                    "There is no helper, or it left before it took the request. Nothing was done.", true},
    ExitStatusFacts{ExitStatus::timedOut, "no answer in time",
                    "No answer in time. What was asked may still be carried out."},
    ExitStatusFacts{ExitStatus::protocol, "protocol broken",
                    "The helper and this program do not understand each other, or the helper left without an "
                    "answer to what may have been carried out.",
                    true},
    ExitStatusFacts{ExitStatus::outputLost, "output lost",
                    "Done, but not everything could be written to standard output."},
};

// How a program ends after this code of the client library.
ExitStatus statusOfCode(std::int32_t code) noexcept;

// "Exit status: 0 done; 1 failed; ...", of a program that asks the helper or of one that does not.
std::string exitStatusLine(bool asksHelper);

}  // namespace brenvik::tools
