// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <string>

#include "platform/plist/PropertyList.h"
#include "tools/support/Parameters.h"

// What was given on the command line as the property lists that the helper takes. All of it throws UsageError
// when a value does not fit.
namespace brenvik::tools {

// `type` is one of the choices of --type but "plist-file". With isSecret a message does not repeat the text.
PropertyList valueOfType(const std::string& type, const std::string& text, bool isSecret = false);

// The binary form.
std::string serialized(const PropertyList& value);

// The property list to send for VALUE of "prefs set", serialized. Reads standard input or a file where VALUE
// says so.
std::string valueToStore(const Values& values);

// The domain itself. A name that is no file's is refused here, because the helper stores nothing under it,
// and its answer does not say so.
const std::string& domainOfAFile(const std::string& domain);

}  // namespace brenvik::tools
