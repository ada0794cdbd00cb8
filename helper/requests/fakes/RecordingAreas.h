// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <cstring>
#include <functional>
#include <string>
#include <string_view>
#include <tuple>
#include <vector>

#include "helper/requests/RequestTable.h"

namespace brenvik {

// Stands in for the areas: writes down each call, returns what the test wants and answers with recognisable
// results.
class RecordingAreas {
 public:
  std::string called;  // the name of the area's routine
  PortName port = kNullPort;
  std::vector<std::string> texts;  // the whole field up to a NUL
  std::vector<std::int32_t> integers;
  std::vector<double> numbers;
  std::vector<std::string> regions;

  KernelReturn answer = kern::success;
  std::string text = "a text";       // for the routines that answer with one
  std::function<void()> whenCalled;  // runs within each routine
  char region[5] = {'b', 'y', 't', 'e', 's'};
  OutOfLinePayload payload{region, sizeof region};

  template <auto routine, class... Arguments, class... Results>
  KernelReturn call(PortName arrivedOn, const std::tuple<Arguments...>& arguments, Results*... results) {
    called = nameOf<routine>();
    port = arrivedOn;
    texts.clear();
    integers.clear();
    numbers.clear();
    regions.clear();
    std::apply([&](auto&... each) { (note(each), ...); }, arguments);
    (write(results), ...);
    if (whenCalled) whenCalled();
    return answer;
  }

 private:
  // As the compiler writes it: "... routine = &brenvik::Area::name ..." or "... routine = brenvik::name ...".
  template <auto routine>
  static std::string nameOf() {
    std::string_view name = __PRETTY_FUNCTION__;
    name.remove_prefix(name.find("routine = "));
    name = name.substr(0, name.find_first_of(";]("));
    return std::string(name.substr(name.rfind(':') + 1));
  }

  template <std::size_t size>
  void note(const char (&field)[size]) {
    texts.emplace_back(field, ::strnlen(field, size));
  }
  void note(std::int32_t value) { integers.push_back(value); }
  void note(double value) { numbers.push_back(value); }
  // A region comes as its address and its length.
  void note(const void* address) { region_ = static_cast<const char*>(address); }
  void note(std::uint32_t length) { regions.emplace_back(region_, length); }

  void write(std::uint8_t* success) const { *success = 1; }
  void write(char* field) const { text.copy(field, text.size()); }
  void write(OutOfLinePayload* result) const { *result = payload; }

  const char* region_ = nullptr;
};

}  // namespace brenvik
