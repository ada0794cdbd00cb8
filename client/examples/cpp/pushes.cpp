// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors

// A telephony daemon in C++: takes its sockets from the service manager, asks where the phone is, and prints
// the answer. Units, account and entitlement file are those of ../brenvikd.
//
//   c++ -std=c++20 pushes.cpp -o pushes $(pkg-config --cflags --libs brenvik-mobile-helper)
#include <brenvik/mobile_helper.hpp>
#include <cstdio>

namespace {

int fail(const char* what, const bvmh::Error& error) {
  std::fprintf(stderr, "%s: %s\n", what, error.text());
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  // A folder for the sockets is given by tests only.
  auto listener = argc > 2 ? bvmh::Listener::listen(argv[2]) : bvmh::Listener::fromEnvironment();
  if (!listener) return fail("cannot listen", listener.error());
  auto client = bvmh::Client::connect({.socket = argc > 1 ? argv[1] : nullptr});
  if (!client) return fail("cannot connect", client.error());
  if (auto asked = client->requestCountryCodeFromLocation(59.9139, 10.7522); !asked) {
    return fail("cannot ask", asked.error());
  }
  for (;;) {
    auto event = listener->next(std::chrono::seconds(20));
    if (!event) return fail("cannot receive", event.error());
    if (!*event) return fail("no answer", bvmh::Error(BVMH_ERROR_TIMED_OUT));
    const bvmh::Event& push = **event;
    // One that no longer waits is no concern of ours.
    if (push.wantsReply()) (void)listener->reply(push);
    if (push.kind() != BVMH_EVENT_CIVIC_INFO) continue;
    std::printf("country \"%s\", city \"%s\"\n", push.text("CountryCode").value_or("").c_str(),
                push.text("City").value_or("").c_str());
    return 0;
  }
}
