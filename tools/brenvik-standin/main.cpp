// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include <CLI/CLI.hpp>
#include <cstdint>
#include <cstdio>
#include <limits>
#include <string>

#include "tools/support/EventStream.h"

// A telephony daemon that only listens: takes the helper's pushes and notifications, answers as it is told,
// and prints them.
int main(int argc, char** argv) {
  using brenvik::tools::EventStreamOptions;
  constexpr int kWrongUsage = 2;
  try {
    EventStreamOptions options;
    options.program = "brenvik-standin";
    bool hangs = false;
    std::uint64_t most = 0;
    std::uint32_t helperUid = 0;
    CLI::App app(
        "Stands in for the telephony daemon: prints the helper's pushes and notifications, and answers.",
        options.program);
    app.set_version_flag("--version", "brenvik-standin " BRENVIK_VERSION);
    app.add_flag("--json", options.asJson, "print one JSON object a line");
    CLI::Option* refuse =
        app.add_option("--refuse", options.errorCode, "answer every push with this error code")
            ->option_text("CODE")
            ->check(CLI::Range(1, std::numeric_limits<int>::max()));
    app.add_flag("--hang", hangs, "never answer a push")->excludes(refuse);
    CLI::Option* count = app.add_option("--count", most, "leave after so many pushes and notifications")
                             ->option_text("N")
                             ->check(CLI::Range(1, std::numeric_limits<int>::max()));
    app.add_option("--directory", options.directory, "folder of named services")->option_text("DIR");
    CLI::Option* uid =
        app.add_option("--helper-uid", helperUid, "take messages from this user too")->option_text("UID");
    try {
      app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
      return app.exit(error) == 0 ? 0 : kWrongUsage;
    }
    options.answers = !hangs;
    if (count->count() != 0) options.most = most;
    if (uid->count() != 0) options.helperUid = helperUid;
    return brenvik::tools::printEvents(options);
  } catch (const std::exception& error) {
    std::fprintf(stderr, "brenvik-standin: %s\n", error.what());
    return kWrongUsage;
  }
}
