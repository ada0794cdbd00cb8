// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <string_view>

#include "tools/support/ExitStatus.h"

// Standard output, checked to the last byte, and what is only for a person at a terminal.
namespace brenvik::tools {

// To be called first of all. A standard stream that is closed gets a descriptor that fails, so that no socket
// or file of ours takes its number; a reader that has gone is an error to be told, not the end of the
// process.
void prepareStandardStreams() noexcept;

// Writes to standard output, which is buffered. False, then and ever after, when something was lost.
bool printOut(std::string_view text) noexcept;
// Brings everything out. False as above.
bool flushOutput() noexcept;
// Brings everything out and gives the exit status: `status`, or outputLost instead of done, told on standard
// error in the name of `program`.
int finishOutput(const char* program, ExitStatus status) noexcept;

enum class Stream : bool { output, error };

// A terminal, so that tables and progress make sense.
bool isTerminal(Stream stream) noexcept;
// A terminal that takes colours, and nobody set NO_COLOR.
bool wantsColour(Stream stream) noexcept;

enum class Look : unsigned char { strong, bad, quiet };
// The text in that look when the stream wants colours, else as it is.
std::string styled(Look look, const std::string& text, Stream stream);

}  // namespace brenvik::tools
