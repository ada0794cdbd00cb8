// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>
#include <string_view>

#include "tools/support/ExitStatus.h"

// Standard output, checked to the last byte, and what is only for a person at a terminal.
namespace brenvik::tools {

// Call this first. A standard stream that is closed gets a descriptor that fails, so that no socket
// or file of ours takes its number; a reader that has gone is an error to be told, not the end of the
// process.
void prepareStandardStreams() noexcept;

// Writes to standard output, which is buffered. Returns false when something was lost, and from then on.
bool printOut(std::string_view text) noexcept;
// Flushes. Returns false as printOut does.
bool flushOutput() noexcept;
// Flushes and returns the exit status: `status`, or outputLost instead of done. A loss is told on standard
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
