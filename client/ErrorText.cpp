// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "client/include/brenvik/mobile_helper.h"

extern "C" const char* bvmh_error_text(int32_t code) {
  switch (code) {
    case BVMH_OK:
      return "success";
    case BVMH_NO_SPACE:
      return "no space";
    case BVMH_FAILURE:
      return "the helper could not do it";
    case BVMH_RESOURCE_SHORTAGE:
      return "the helper is out of memory or descriptors";
    case BVMH_NO_ACCESS:
      return "the helper does not touch that path";
    case BVMH_MEMORY_FAILURE:
      return "the file gave no property list";
    case BVMH_INVALID_SECURITY:
      return "the caller lacks the entitlement com.norvale.Teravox.BrenvikHelper.allow";
    case BVMH_NOT_SUPPORTED:
      return "not supported by this build of the helper";
    case BVMH_TYPE_ERROR:
      return "the helper found a wrong descriptor in the request";
    case BVMH_BAD_ID:
      return "the helper does not know the request";
    case BVMH_BAD_ARGUMENTS:
      return "the helper found the request malformed";
    case BVMH_TRAILER_ERROR:
      return "the helper could not tell who asked";
    case BVMH_ERROR_INVALID_ARGUMENT:
      return "an argument is missing or does not fit";
    case BVMH_ERROR_NO_MEMORY:
      return "out of memory";
    case BVMH_ERROR_NOT_CONNECTED:
      return "not connected to the helper";
    case BVMH_ERROR_UNREACHABLE:
      return "no helper answers at its socket";
    case BVMH_ERROR_TIMED_OUT:
      return "no answer in time";
    case BVMH_ERROR_HELPER_GONE:
      return "the helper left before it took the request";
    case BVMH_ERROR_ANSWER_LOST:
      return "the helper left without answering; the request may have been carried out";
    case BVMH_ERROR_PROTOCOL:
      return "the answer breaks the protocol";
    case BVMH_ERROR_SYSTEM:
      return "a system call failed";
    case BVMH_ERROR_NAME_IN_USE:
      return "another process serves that name";
    case BVMH_ERROR_NOT_HANDED_OVER:
      return "the service manager handed over no such socket";
    case BVMH_ERROR_NO_LONGER_THERE:
      return "the sender no longer waits for an answer";
    case BVMH_ERROR_INTERRUPTED:
      return "the call was interrupted";
    case BVMH_ERROR_TOO_MANY_CALLS:
      return "too many calls have been begun and their results not taken";
    case BVMH_ERROR_IN_PROGRESS:
      return "the call has no result yet";
    case BVMH_ERROR_NO_SUCH_CALL:
      return "no such call";
    case BVMH_ERROR_NOT_A_VALUE:
      return "not a property list, or one beyond a limit";
    case BVMH_ERROR_AMBIGUOUS:
      return "the push could answer more than one question";
    case BVMH_ERROR_NAME_LOST:
      return "the service's socket file is gone";
    case BVMH_ERROR_NOT_ASKED:
      return "the push answers no question of this client";
    default:
      return code >= BVMH_ERROR_FIRST && code <= BVMH_ERROR_LAST
                 ? "unknown transport failure"
                 : "the helper answered with a code of its system";
  }
}
