// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include "interface/Wire.h"

// Every request and every reply, byte for byte. Strings are char arrays that need not be terminated.
namespace brenvik {

inline constexpr const char kServiceName[] = "com.norvale.brenvik.mobile-helper";

// ---- check-in, the only routine of the service port -------------------------------------------------------

struct [[gnu::packed]] CheckInRequest {
  MessageHeader header;
  std::uint32_t descriptorCount;
  PortDescriptor clientPort;
};
static_assert(sizeof(CheckInRequest) == 40 && offsetof(CheckInRequest, header) == 0 &&
              offsetof(CheckInRequest, descriptorCount) == 24 && offsetof(CheckInRequest, clientPort) == 28);

struct [[gnu::packed]] CheckInReply {
  MessageHeader header;
  std::uint32_t descriptorCount;
  PortDescriptor servicePort;
};
static_assert(sizeof(CheckInReply) == 40 && offsetof(CheckInReply, header) == 0 &&
              offsetof(CheckInReply, descriptorCount) == 24 && offsetof(CheckInReply, servicePort) == 28);

// ---- requests -------------------------------------------------------------------------------------------

// No arguments, and no NDR record.
struct [[gnu::packed]] EmptyRequest {
  MessageHeader header;
};
static_assert(sizeof(EmptyRequest) == 24 && offsetof(EmptyRequest, header) == 0);

struct [[gnu::packed]] String256Request {
  MessageHeader header;
  NdrRecord ndr;
  char text[256];
};
static_assert(sizeof(String256Request) == 288 && offsetof(String256Request, header) == 0 &&
              offsetof(String256Request, ndr) == 24 && offsetof(String256Request, text) == 32);

struct [[gnu::packed]] TwoStrings256Request {
  MessageHeader header;
  NdrRecord ndr;
  char first[256];
  char second[256];
};
static_assert(sizeof(TwoStrings256Request) == 544 && offsetof(TwoStrings256Request, header) == 0 &&
              offsetof(TwoStrings256Request, ndr) == 24 && offsetof(TwoStrings256Request, first) == 32 &&
              offsetof(TwoStrings256Request, second) == 288);

struct [[gnu::packed]] ThreeStrings256Request {
  MessageHeader header;
  NdrRecord ndr;
  char first[256];
  char second[256];
  char third[256];
};
static_assert(sizeof(ThreeStrings256Request) == 800 && offsetof(ThreeStrings256Request, header) == 0 &&
              offsetof(ThreeStrings256Request, ndr) == 24 && offsetof(ThreeStrings256Request, first) == 32 &&
              offsetof(ThreeStrings256Request, second) == 288 &&
              offsetof(ThreeStrings256Request, third) == 544);

struct [[gnu::packed]] TwoStrings1024Request {
  MessageHeader header;
  NdrRecord ndr;
  char first[1024];
  char second[1024];
};
static_assert(sizeof(TwoStrings1024Request) == 2080 && offsetof(TwoStrings1024Request, header) == 0 &&
              offsetof(TwoStrings1024Request, ndr) == 24 && offsetof(TwoStrings1024Request, first) == 32 &&
              offsetof(TwoStrings1024Request, second) == 1056);

struct [[gnu::packed]] ThreeStrings1024Request {
  MessageHeader header;
  NdrRecord ndr;
  char first[1024];
  char second[1024];
  char third[1024];
};
static_assert(sizeof(ThreeStrings1024Request) == 3104 && offsetof(ThreeStrings1024Request, header) == 0 &&
              offsetof(ThreeStrings1024Request, ndr) == 24 &&
              offsetof(ThreeStrings1024Request, first) == 32 &&
              offsetof(ThreeStrings1024Request, second) == 1056 &&
              offsetof(ThreeStrings1024Request, third) == 2080);

struct [[gnu::packed]] IntegerRequest {
  MessageHeader header;
  NdrRecord ndr;
  std::int32_t value;
};
static_assert(sizeof(IntegerRequest) == 36 && offsetof(IntegerRequest, header) == 0 &&
              offsetof(IntegerRequest, ndr) == 24 && offsetof(IntegerRequest, value) == 32);

struct [[gnu::packed]] CoordinateRequest {
  MessageHeader header;
  NdrRecord ndr;
  double latitude;   // degrees
  double longitude;  // degrees
};
static_assert(sizeof(CoordinateRequest) == 48 && offsetof(CoordinateRequest, header) == 0 &&
              offsetof(CoordinateRequest, ndr) == 24 && offsetof(CoordinateRequest, latitude) == 32 &&
              offsetof(CoordinateRequest, longitude) == 40);

struct [[gnu::packed]] TwoStrings64Request {
  MessageHeader header;
  NdrRecord ndr;
  char first[64];
  char second[64];
};
static_assert(sizeof(TwoStrings64Request) == 160 && offsetof(TwoStrings64Request, header) == 0 &&
              offsetof(TwoStrings64Request, ndr) == 24 && offsetof(TwoStrings64Request, first) == 32 &&
              offsetof(TwoStrings64Request, second) == 96);

struct [[gnu::packed]] SetPreferenceValueRequest {
  MessageHeader header;
  std::uint32_t descriptorCount;
  OutOfLineDescriptor value;
  NdrRecord ndr;
  char domain[256];
  char key[256];
  std::uint32_t valueLength;
};
static_assert(sizeof(SetPreferenceValueRequest) == 568 && offsetof(SetPreferenceValueRequest, header) == 0 &&
              offsetof(SetPreferenceValueRequest, descriptorCount) == 24 &&
              offsetof(SetPreferenceValueRequest, value) == 28 &&
              offsetof(SetPreferenceValueRequest, ndr) == 44 &&
              offsetof(SetPreferenceValueRequest, domain) == 52 &&
              offsetof(SetPreferenceValueRequest, key) == 308 &&
              offsetof(SetPreferenceValueRequest, valueLength) == 564);

struct [[gnu::packed]] LabelsRequest {
  MessageHeader header;
  std::uint32_t descriptorCount;
  OutOfLineDescriptor labels;
  OutOfLineDescriptor languages;
  NdrRecord ndr;
  std::uint32_t labelsLength;
  std::uint32_t languagesLength;
};
static_assert(sizeof(LabelsRequest) == 76 && offsetof(LabelsRequest, header) == 0 &&
              offsetof(LabelsRequest, descriptorCount) == 24 && offsetof(LabelsRequest, labels) == 28 &&
              offsetof(LabelsRequest, languages) == 44 && offsetof(LabelsRequest, ndr) == 60 &&
              offsetof(LabelsRequest, labelsLength) == 68 && offsetof(LabelsRequest, languagesLength) == 72);

// ---- replies --------------------------------------------------------------------------------------------

struct [[gnu::packed]] StatusReply {
  MessageHeader header;
  NdrRecord ndr;
  KernelReturn returnCode;
};
static_assert(sizeof(StatusReply) == 36 && offsetof(StatusReply, header) == 0 &&
              offsetof(StatusReply, ndr) == 24 && offsetof(StatusReply, returnCode) == 32);

struct [[gnu::packed]] IntegerReply {
  StatusReply status;
  std::uint8_t result[4];  // a boolean is one byte, 1 true, in result[0]
};
static_assert(sizeof(IntegerReply) == 40 && offsetof(IntegerReply, status) == 0 &&
              offsetof(IntegerReply, result) == 36);

struct [[gnu::packed]] String64Reply {
  StatusReply status;
  char text[64];
};
static_assert(sizeof(String64Reply) == 100 && offsetof(String64Reply, status) == 0 &&
              offsetof(String64Reply, text) == 36);

struct [[gnu::packed]] String256Reply {
  StatusReply status;
  char text[256];
};
static_assert(sizeof(String256Reply) == 292 && offsetof(String256Reply, status) == 0 &&
              offsetof(String256Reply, text) == 36);

struct [[gnu::packed]] OutOfLineReply {
  MessageHeader header;
  std::uint32_t descriptorCount;
  OutOfLineDescriptor payload;
  NdrRecord ndr;
  std::uint32_t byteCount;
};
static_assert(sizeof(OutOfLineReply) == 56 && offsetof(OutOfLineReply, header) == 0 &&
              offsetof(OutOfLineReply, descriptorCount) == 24 && offsetof(OutOfLineReply, payload) == 28 &&
              offsetof(OutOfLineReply, ndr) == 44 && offsetof(OutOfLineReply, byteCount) == 52);

}  // namespace brenvik
