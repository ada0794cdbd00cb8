// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors

// Stores a preference, reads it back, and tells the country.
//
//   c++ -std=c++20 preferences.cpp -o preferences $(pkg-config --cflags --libs brenvik-mobile-helper)
#include <brenvik/mobile_helper.hpp>
#include <cstdio>

namespace {

int fail(const char* what, const bvmh::Error& error) {
  std::fprintf(stderr, "%s: %s\n", what, error.text());
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  // The socket is given by tests only; without it the library knows where the helper is.
  auto client = bvmh::Client::connect({.socket = argc > 1 ? argv[1] : nullptr});
  if (!client) return fail("cannot connect", client.error());

  const char* const greeting = R"(<plist version="1.0"><string>Hello</string></plist>)";
  if (auto stored = client->setPreferenceValue("com.example.greeting", "text", greeting); !stored) {
    return fail("cannot store", stored.error());
  }
  auto value = client->copyPreferenceValue("com.example.greeting", "text");
  if (!value) return fail("cannot read", value.error());
  std::printf("%zu bytes of XML\n", value->size());

  auto country = client->copyCountryCode();
  if (!country) return fail("no country", country.error());
  std::printf("country \"%s\"\n", country->c_str());
}
