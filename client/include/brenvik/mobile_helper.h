/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */
#ifndef BRENVIK_MOBILE_HELPER_H
#define BRENVIK_MOBILE_HELPER_H

/*
 * Client of BrenvikMobileHelper: check in, call its 27 routines, receive its pushes and notifications.
 *
 *   bvmh_client* client = bvmh_client_create();
 *   int32_t code = bvmh_connect(client);
 *   if (code == BVMH_OK) code = BVMobileHelperSetVoicemailToken(client, "token");
 *   if (code != BVMH_OK) fprintf(stderr, "%s\n", bvmh_error_text(code));
 *   bvmh_client_free(client);
 *
 * Threads: any thread may use an object (client, listener or value), but only one at a time; different
 * objects are independent. Only bvmh_client_interrupt may be called at any time. The library does not touch
 * signals or the working directory, and only bvmh_listener_create_from_environment reads the environment. The
 * library never raises SIGPIPE; every descriptor is close-on-exec. After fork() only one of the two processes
 * may continue to use an object.
 *
 * Texts are UTF-8 and end with a NUL. The helper resolves paths in its own working directory and under its
 * own account, so pass absolute paths.
 */

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#if defined(__GNUC__)
#define BVMH_API __attribute__((visibility("default")))
#define BVMH_CHECKED __attribute__((warn_unused_result))
#else
#define BVMH_API
#define BVMH_CHECKED
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* ---- version --------------------------------------------------------------------------------------------
 */

/* The version of this header; bvmh_version() returns the version of the loaded library. A program runs with
 * the 0.x version that it was built against and with every later one. */
#define BVMH_VERSION_MAJOR 0
#define BVMH_VERSION_MINOR 1
#define BVMH_VERSION_PATCH 1
#define BVMH_VERSION_NUMBER(major, minor, patch) (((major) << 16) | ((minor) << 8) | (patch))
#define BVMH_VERSION BVMH_VERSION_NUMBER(BVMH_VERSION_MAJOR, BVMH_VERSION_MINOR, BVMH_VERSION_PATCH)
BVMH_API uint32_t bvmh_version(void);

/* ---- results ------------------------------------------------------------------------------------------- */

/*
 * Every function that can fail returns an int32_t: 0, a code from the helper's answer (positive kernel-style
 * codes, and message-layer codes from -300 to -309; codes not listed here are passed through), or a failure
 * of the transport, BVMH_ERROR_*, from -7099 to -7001. The helper never answers with a code of that last
 * range: an answer with such a code is BVMH_ERROR_PROTOCOL.
 */
enum {
  BVMH_OK = 0,

  /* answered by the helper */
  BVMH_NO_SPACE = 3,
  BVMH_FAILURE = 5,           /* bad text, bad property list, or the work itself failed */
  BVMH_RESOURCE_SHORTAGE = 6, /* the helper is out of memory or descriptors */
  BVMH_NO_ACCESS = 8,         /* the path is outside the places that the routine may touch */
  BVMH_MEMORY_FAILURE = 9,    /* the file gave no property list */
  BVMH_INVALID_SECURITY = 35, /* the caller lacks the entitlement, or may not even connect */
  BVMH_NOT_SUPPORTED = 46,    /* not in this build of the helper */
  BVMH_TYPE_ERROR = -300,
  BVMH_BAD_ID = -303,
  BVMH_BAD_ARGUMENTS = -304,
  BVMH_TRAILER_ERROR = -309,

  /* the transport's own */
  BVMH_ERROR_FIRST = -7099,
  BVMH_ERROR_NAME_LOST = -7020,    /* listener: its socket file is gone; nobody can connect to it any more */
  BVMH_ERROR_NOT_ASKED = -7019,    /* push: no question of this client is under way that it could answer */
  BVMH_ERROR_AMBIGUOUS = -7018,    /* push: more than one question is under way that it could answer */
  BVMH_ERROR_NOT_A_VALUE = -7017,  /* value: the bytes are no property list, or one beyond a limit */
  BVMH_ERROR_NO_SUCH_CALL = -7016, /* begun call: cancelled, its result was taken, or never begun */
  BVMH_ERROR_IN_PROGRESS = -7015,  /* begun call: there is no result yet */
  BVMH_ERROR_TOO_MANY_CALLS = -7014,  /* begun call: BVMH_MOST_CALLS are there already; nothing was sent */
  BVMH_ERROR_INTERRUPTED = -7013,     /* bvmh_client_interrupt; what was sent may still be carried out */
  BVMH_ERROR_NOT_HANDED_OVER = -7012, /* listener: the service manager gave this process no such socket */
  BVMH_ERROR_NO_LONGER_THERE = -7011, /* listener: the sender of the push has gone */
  BVMH_ERROR_NAME_IN_USE = -7010,     /* listener: another live process serves the name */
  BVMH_ERROR_SYSTEM = -7009,          /* a system call failed: see bvmh_client_errno */
  BVMH_ERROR_PROTOCOL = -7008,        /* the answer breaks the protocol; the channel was closed */
  BVMH_ERROR_ANSWER_LOST = -7007,     /* the helper left without answering: it may have been carried out */
  BVMH_ERROR_HELPER_GONE = -7006,     /* the helper left before it took the request: not carried out */
  BVMH_ERROR_TIMED_OUT = -7005,       /* no answer in time; what was sent may still be carried out */
  BVMH_ERROR_UNREACHABLE = -7004,     /* nobody answers at the socket: see bvmh_client_errno */
  BVMH_ERROR_NOT_CONNECTED = -7003,   /* no bvmh_connect, or it failed; nothing was sent */
  BVMH_ERROR_NO_MEMORY = -7002,
  BVMH_ERROR_INVALID_ARGUMENT = -7001, /* a null pointer, or a text too long; nothing was sent */
  BVMH_ERROR_LAST = -7001
};

/* Describes a code in English, without a full stop. Never NULL; the text is never freed. */
BVMH_API const char* bvmh_error_text(int32_t code);

/* ---- the client ---------------------------------------------------------------------------------------- */

typedef struct bvmh_client bvmh_client;

#define BVMH_DEFAULT_TIMEOUT_MS 30000u

/* Sizes of buffers for texts that the helper returns, in bytes, the closing NUL included. */
#define BVMH_TOKEN_SIZE 257
#define BVMH_COUNTRY_CODE_SIZE 65

/* Returns a client that is not connected yet. NULL: out of memory. */
BVMH_API bvmh_client* bvmh_client_create(void);
/* Disconnects and frees the client; the helper then drops the client's state. NULL is allowed. */
BVMH_API void bvmh_client_free(bvmh_client* client);

/*
 * Sets the time-out of later calls, in milliseconds: the whole time that one call may take, including
 * connecting, sending and retries. 0 stands for the default, BVMH_DEFAULT_TIMEOUT_MS.
 */
BVMH_API void bvmh_client_set_timeout(bvmh_client* client, uint32_t milliseconds);
/*
 * Sets the path of the helper's service socket for the next connect; for tests. NULL stands for the path
 * compiled in, bvmh_service_socket(). The text is copied.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_client_set_socket(bvmh_client* client, const char* path);
BVMH_API const char* bvmh_service_socket(void);
/* The folder of named services that was compiled in. */
BVMH_API const char* bvmh_bootstrap_directory(void);

/*
 * Connects to the helper and checks in; does nothing if the client is already connected. If the helper stops
 * before it answers, the library tries again for about a second, but never beyond the time-out.
 * BVMH_INVALID_SECURITY: the helper refused this program. If bvmh_client_errno is EACCES, the kernel refused
 * it: the account must join the group that may connect ("brenvik"; usermod -aG brenvik ACCOUNT), log in
 * again, and then be entitled. BVMH_ERROR_UNREACHABLE: no helper.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_connect(bvmh_client* client);
/* Disconnects from the helper. Answers still to come are lost: calls that were begun end with
 * BVMH_ERROR_ANSWER_LOST if they had been sent, else with BVMH_ERROR_NOT_CONNECTED. */
BVMH_API void bvmh_disconnect(bvmh_client* client);
/* bvmh_disconnect, then bvmh_connect. */
BVMH_API BVMH_CHECKED int32_t bvmh_reconnect(bvmh_client* client);
/* The errno behind the last BVMH_ERROR_UNREACHABLE or BVMH_ERROR_SYSTEM of this client; EACCES if the last
 * code was BVMH_INVALID_SECURITY and came from the kernel; else 0. */
BVMH_API int bvmh_client_errno(const bvmh_client* client);
/*
 * Makes the blocking call that is under way on this client return BVMH_ERROR_INTERRUPTED at once. If there is
 * none, the next blocking call returns that before it sends anything. Each use interrupts one call. It may be
 * called from any thread and from a signal handler, as long as the client is not being freed. The client
 * stays usable; it may lose its channel, and the next call then checks in again by itself. Calls that were
 * begun and the listener are not affected. NULL is allowed.
 */
BVMH_API void bvmh_client_interrupt(bvmh_client* client);

/*
 * A region of bytes that a routine returned. The caller owns it and frees it with bvmh_region_free.
 * If there is no value, bytes is NULL and size is 0. No NUL follows the bytes.
 */
typedef struct bvmh_region {
  const void* bytes;
  size_t size;
  void* owner;    /* the library's */
  void* reserved; /* NULL */
} bvmh_region;

/* Frees the bytes and makes the region empty. NULL and an empty region are allowed. */
BVMH_API void bvmh_region_free(bvmh_region* region);

/* ---- routines ------------------------------------------------------------------------------------------ */

/*
 * One function for each routine. It sends one request and waits for the answer, at most the client's
 * time-out. After BVMH_ERROR_TIMED_OUT the client stays usable; a late answer is recognised and dropped. If
 * the helper has left since the last call, the function checks in again, once, and only if its request has
 * certainly not been carried out; a request that may have been carried out is never sent twice. Results are
 * written only on BVMH_OK, except regions, which are made empty first.
 */

/* Voicemail. Keys and tokens: at most 255 bytes. A buffer for a token must have at least BVMH_TOKEN_SIZE
 * bytes; a token that was never set is the empty text. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetVoicemailToken(bvmh_client* client, const char* token);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetVoicemailTokenForKey(bvmh_client* client, const char* key,
                                                                    const char* token);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperClearVoicemailToken(bvmh_client* client);
/* Clears the general token and removes every record of the store. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperResetVoicemailStore(bvmh_client* client);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyVoicemailTokenForKey(bvmh_client* client, const char* key,
                                                                     char* token, size_t capacity);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyVoicemailToken(bvmh_client* client, char* token,
                                                               size_t capacity);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperIsVoicemailServiceSubscribed(bvmh_client* client,
                                                                         bool* subscribed);

/* Preferences of the helper's own account, any host. Domain and key: at most 255 bytes. */

/* Stores a value: a property list, XML or binary, of at most 511 levels and, as XML, 64 MiB. A value of
 * exactly one byte, of any value, removes the key. BVMH_FAILURE: the bytes are not a property list, or it is
 * too large; nothing was changed. The result is BVMH_OK even if the value is too deep, writing to the disk
 * failed, or the domain does not name a file (it is empty, "." or "..", or contains a slash): then only the
 * helper's log says so. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetPreferenceValue(bvmh_client* client, const char* domain,
                                                               const char* key, const void* value,
                                                               size_t length);
/* Returns the value as an XML property list; an empty region if there is none. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyPreferenceValue(bvmh_client* client, const char* domain,
                                                                const char* key, bvmh_region* value);
/* The same in application scope, which also looks at this host's and every user's values. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyAppPreferenceValue(bvmh_client* client, const char* domain,
                                                                   const char* key, bvmh_region* value);
/* Reads a property-list file whose top level is a dictionary (at most 255 bytes of path) and returns it as
 * XML. BVMH_MEMORY_FAILURE: the file cannot be read or is not a dictionary. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperLoadPlistFile(bvmh_client* client, const char* path,
                                                          bvmh_region* plist);

/* Carrier files. Paths and domains of the first three: at most 1023 bytes, of the others 255. */

/* Replaces one of the known carrier links with a link to target, then drops cached values of the preference
 * domain ("" for none). BVMH_NO_ACCESS: link_path is not a known link, or is a directory. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperReplaceCarrierSymlink(bvmh_client* client, const char* target,
                                                                  const char* link_path, const char* domain);
/* Replaces any file at link_path with a link to target. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCreateSymlink(bvmh_client* client, const char* target,
                                                          const char* link_path);
/* Drops cached values of the domain ("" for none), then removes a carrier file or an empty folder. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRemoveCarrierFile(bvmh_client* client, const char* path,
                                                              const char* domain);
/* The next four return BVMH_OK even if the work failed; *success says whether it did, and the helper's log
 * has the reason. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyCarrierFile(bvmh_client* client, const char* source_directory,
                                                            const char* destination_directory,
                                                            const char* file_name, bool* success);
/* Copies a folder into the crash logs of the account "mobile". */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyCrashLogs(bvmh_client* client, const char* path,
                                                          bool* success);
/* Moves a folder to destination_directory/name. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperMoveIntoCarrierBundles(bvmh_client* client,
                                                                   const char* source_path,
                                                                   const char* destination_directory,
                                                                   const char* name, bool* success);
/* Unpacks a zip archive into a folder. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperUnpackArchive(bvmh_client* client, const char* archive_path,
                                                          const char* destination_path, bool* success);

/* Location. The two requests return at once; their answers arrive as pushes, see bvmh_listener. */

/* In degrees. If both are exactly 0, there is no position, and the push holds only the configured country. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRequestCountryCodeFromLocation(bvmh_client* client,
                                                                           double latitude, double longitude);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRequestWanIPFromLocation(bvmh_client* client);
/* The country code known now, "" if none. The buffer must have at least BVMH_COUNTRY_CODE_SIZE bytes. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyCountryCode(bvmh_client* client, char* country_code,
                                                            size_t capacity);

/* Labels. Both arguments are serialized property lists, XML or binary, whose top level is an array; the
 * languages are texts such as "de" or "pt-BR". The result is an XML property list, an array of texts. */

/* labels: pairs of a label key ("USER_LABEL_PRIMARY" ...) and an ignored text, or of "" and a label's own
 * text. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyBadgeLabels(bvmh_client* client, const void* labels,
                                                            size_t labels_length, const void* languages,
                                                            size_t languages_length, bvmh_region* result);
/* labels: label keys. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyLocalizedLabels(bvmh_client* client, const void* labels,
                                                                size_t labels_length, const void* languages,
                                                                size_t languages_length, bvmh_region* result);

/* Moves every contact's reference from one channel identifier to another; at most 63 bytes each. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRemapContactsChannel(bvmh_client* client, const char* from,
                                                                 const char* to, bool* success);

/* Non-zero: sends one echo every two seconds over the cellular interface and keeps the helper running; 0:
 * off. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCellularHeartbeat(bvmh_client* client, int32_t value);

enum { BVMH_LASD_UMTS = 1, BVMH_LASD_CDMA = 2, BVMH_LASD_LTE = 4, BVMH_LASD_GSM = 8, BVMH_LASD_SCDMA = 16 };
/* Starts an update check of the databases whose BVMH_LASD_* bits are set; the outcome arrives as
 * notifications, see bvmh_listener. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCheckLASDUpdate(bvmh_client* client, int32_t value);

/* Non-zero: the radio manager logs to a file; 0: it does not. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperEnableRadioManagerLogs(bvmh_client* client, int32_t enable);

/* ---- calls that do not block ----------------------------------------------------------------------------
 */

/*
 * For programs with an event loop. Beginning a call never waits. Whenever bvmh_client_fd is readable,
 * bvmh_process does the work that needs no waiting; then take the results of finished calls, in the order in
 * which they finished:
 *
 *   bvmh_begin_connect(client, NULL, NULL);
 *   BVMobileHelperCopyCountryCodeBegin(client, my_context, NULL);
 *   ...
 *   when the descriptor is readable:
 *     bvmh_process(client);
 *     while (bvmh_take_result(client, 0, &result) == BVMH_OK) {
 *       use result.context, result.code, result.text;
 *       bvmh_result_free(&result);
 *     }
 *
 * Many calls may be under way on one client; the helper carries them out in the order in which they were
 * begun. Each has the client's time-out, counted from its beginning, and ends with exactly one result unless
 * it is cancelled. Blocking calls may be made meanwhile: they wait for their turn and keep the results of the
 * others.
 *
 * If the helper leaves, the client checks in again by itself. Of the calls that had been sent, the oldest
 * without an answer may have been carried out, so it ends with BVMH_ERROR_ANSWER_LOST. The others were not
 * carried out, because the helper reads a request only after it has answered the previous one; they are sent
 * again, once.
 */

/* The number of a call that was begun: never 0, never used twice by a client. */
typedef uint64_t bvmh_call;

/* The most calls that a client can have begun without taking their results. */
#define BVMH_MOST_CALLS 4096

typedef struct bvmh_result {
  bvmh_call call;
  void* context;              /* as it was given when the call was begun */
  int32_t message_id;         /* of the routine, as docs/protocol.md numbers them; of a check-in 4792174 */
  int32_t code;               /* what the blocking call would have returned */
  int system_error;           /* the errno behind it, as bvmh_client_errno */
  bool boolean;               /* routines with a bool: *success or *subscribed */
  char text[BVMH_TOKEN_SIZE]; /* routines with a buffer: the token or the country code; else empty */
  bvmh_region region;         /* routines with a region; else empty */
  uint64_t reserved[4];
} bvmh_result;

/*
 * A descriptor that is readable when bvmh_process has something to do, or while results wait to be taken. The
 * client owns it, and it stays the same as long as the client lives. -1: it could not be made; see
 * bvmh_client_errno.
 */
BVMH_API int bvmh_client_fd(bvmh_client* client);
/* Sends, receives and notices time-outs, without waiting. Calling it too often is harmless.
 * BVMH_ERROR_INVALID_ARGUMENT for NULL, else BVMH_OK: a call's outcome is in its result. */
BVMH_API int32_t bvmh_process(bvmh_client* client);
/*
 * Takes the result of a call, or, for number 0, of the call that finished first; the caller frees it with
 * bvmh_result_free. BVMH_ERROR_IN_PROGRESS: there is no result yet. BVMH_ERROR_NO_SUCH_CALL: there will be
 * none. In both cases *result is empty.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_take_result(bvmh_client* client, bvmh_call call, bvmh_result* result);
/* Frees the region and empties the result. NULL and an empty result are allowed. */
BVMH_API void bvmh_result_free(bvmh_result* result);
/*
 * Cancels a call: it gets no result, and a result that is already there is freed. A request that was sent may
 * still be carried out; its answer is recognised and dropped. BVMH_ERROR_NO_SUCH_CALL: there is no such call.
 */
BVMH_API int32_t bvmh_cancel(bvmh_client* client, bvmh_call call);

/*
 * Begins to check in; the result has the code that bvmh_connect would have returned. Further calls can be
 * begun at once: they wait for the check-in, and end with its code if it fails. The number of the call is
 * stored in *call unless call is NULL; the result hands the context back.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_begin_connect(bvmh_client* client, void* context, bvmh_call* call);

/* Bytes that a call sends. */
typedef struct bvmh_bytes {
  const void* bytes;
  size_t size;
} bvmh_bytes;

/*
 * Begins any routine by its number in docs/protocol.md, with the bytes of its request as that page lays them
 * out. The library fills in the header, the NDR record, the descriptors and the lengths of the regions, so
 * they may be zeroes. Pass one region for each descriptor of the routine, in their order. All bytes are
 * copied. BVMH_ERROR_INVALID_ARGUMENT: no such routine, a wrong size, or a wrong number of regions.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_begin(bvmh_client* client, int32_t message_id, const void* request,
                                         size_t size, const bvmh_bytes* regions, size_t region_count,
                                         void* context, bvmh_call* call);

/*
 * One function for each routine, with the arguments of the blocking one, which are copied. Results other than
 * BVMH_OK mean that nothing was begun: BVMH_ERROR_INVALID_ARGUMENT, BVMH_ERROR_NOT_CONNECTED (neither
 * bvmh_connect nor bvmh_begin_connect), BVMH_ERROR_TOO_MANY_CALLS, BVMH_ERROR_NO_MEMORY.
 */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetVoicemailTokenBegin(bvmh_client* client, const char* token,
                                                                   void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetVoicemailTokenForKeyBegin(bvmh_client* client, const char* key,
                                                                         const char* token, void* context,
                                                                         bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperClearVoicemailTokenBegin(bvmh_client* client, void* context,
                                                                     bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperResetVoicemailStoreBegin(bvmh_client* client, void* context,
                                                                     bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyVoicemailTokenForKeyBegin(bvmh_client* client,
                                                                          const char* key, void* context,
                                                                          bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyVoicemailTokenBegin(bvmh_client* client, void* context,
                                                                    bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperIsVoicemailServiceSubscribedBegin(bvmh_client* client,
                                                                              void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetPreferenceValueBegin(bvmh_client* client, const char* domain,
                                                                    const char* key, const void* value,
                                                                    size_t length, void* context,
                                                                    bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyPreferenceValueBegin(bvmh_client* client, const char* domain,
                                                                     const char* key, void* context,
                                                                     bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyAppPreferenceValueBegin(bvmh_client* client,
                                                                        const char* domain, const char* key,
                                                                        void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperLoadPlistFileBegin(bvmh_client* client, const char* path,
                                                               void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperReplaceCarrierSymlinkBegin(bvmh_client* client,
                                                                       const char* target,
                                                                       const char* link_path,
                                                                       const char* domain, void* context,
                                                                       bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCreateSymlinkBegin(bvmh_client* client, const char* target,
                                                               const char* link_path, void* context,
                                                               bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRemoveCarrierFileBegin(bvmh_client* client, const char* path,
                                                                   const char* domain, void* context,
                                                                   bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyCarrierFileBegin(bvmh_client* client,
                                                                 const char* source_directory,
                                                                 const char* destination_directory,
                                                                 const char* file_name, void* context,
                                                                 bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyCrashLogsBegin(bvmh_client* client, const char* path,
                                                               void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperMoveIntoCarrierBundlesBegin(bvmh_client* client,
                                                                        const char* source_path,
                                                                        const char* destination_directory,
                                                                        const char* name, void* context,
                                                                        bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperUnpackArchiveBegin(bvmh_client* client, const char* archive_path,
                                                               const char* destination_path, void* context,
                                                               bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRequestCountryCodeFromLocationBegin(
    bvmh_client* client, double latitude, double longitude, void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRequestWanIPFromLocationBegin(bvmh_client* client, void* context,
                                                                          bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyCountryCodeBegin(bvmh_client* client, void* context,
                                                                 bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyBadgeLabelsBegin(bvmh_client* client, const void* labels,
                                                                 size_t labels_length, const void* languages,
                                                                 size_t languages_length, void* context,
                                                                 bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyLocalizedLabelsBegin(bvmh_client* client, const void* labels,
                                                                     size_t labels_length,
                                                                     const void* languages,
                                                                     size_t languages_length, void* context,
                                                                     bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRemapContactsChannelBegin(bvmh_client* client, const char* from,
                                                                      const char* to, void* context,
                                                                      bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCellularHeartbeatBegin(bvmh_client* client, int32_t value,
                                                                   void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCheckLASDUpdateBegin(bvmh_client* client, int32_t value,
                                                                 void* context, bvmh_call* call);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperEnableRadioManagerLogsBegin(bvmh_client* client, int32_t enable,
                                                                        void* context, bvmh_call* call);

/* ---- pushes and notifications -------------------------------------------------------------------------- */

/* The telephony daemon's side: serves the two named services that the helper reports to. */
typedef struct bvmh_listener bvmh_listener;

enum { BVMH_PUSHES = 1, BVMH_NOTIFICATIONS = 2 };

/*
 * Listens on the services whose bits are set, in the given folder (NULL: the one compiled in), which is made
 * if it is missing. Replaces a socket file that nobody serves any more. Accepts messages only from the
 * superuser and from this process's own user; closes anyone else's connection at once. BVMH_ERROR_SYSTEM
 * leaves the reason in errno.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_create(const char* directory, unsigned services,
                                                   bvmh_listener** listener);
/*
 * Listens on sockets that somebody else made, for a daemon that may not write to the folder of named
 * services. Each is a listening AF_UNIX socket of type SOCK_SEQPACKET, or -1 for a service that is not
 * wanted; pass at least one. On BVMH_OK the listener owns both descriptors: they become non-blocking and
 * close-on-exec, and are closed with it; their socket files stay. On any other result the caller still owns
 * them. BVMH_ERROR_INVALID_ARGUMENT: one of them is not such a socket, or both are the same.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_create_from_fds(int pushes, int notifications,
                                                            bvmh_listener** listener);
/*
 * The same with the sockets that the service manager handed to this process (LISTEN_PID, LISTEN_FDS and
 * LISTEN_FDNAMES, as sd_listen_fds(3) describes them), found by name: "com.norvale.brenvik" for pushes,
 * "com.norvale.Brenvik.lasd" for notifications. Takes the sockets that exist of the services whose bits are
 * set; descriptors with other names are left alone. BVMH_ERROR_NOT_HANDED_OVER: there are none. Reads the
 * environment without changing it; may be called once.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_create_from_environment(unsigned services,
                                                                    bvmh_listener** listener);
/* Accepts messages from one more user, for a helper that runs under an account of its own. */
BVMH_API void bvmh_listener_allow_uid(bvmh_listener* listener, uint32_t uid);
/* Stops listening and removes the socket files that bvmh_listener_create made. NULL is allowed. */
BVMH_API void bvmh_listener_free(bvmh_listener* listener);
/* A descriptor that is readable when bvmh_listener_next has something to do; the listener owns it. */
BVMH_API int bvmh_listener_fd(const bvmh_listener* listener);
/* The errno behind the last BVMH_ERROR_SYSTEM of this listener; else 0. */
BVMH_API int bvmh_listener_errno(const bvmh_listener* listener);

typedef enum bvmh_event_kind {
  BVMH_EVENT_NONE = 0,
  BVMH_EVENT_CIVIC_INFO = 1,    /* a push with CountryCode, State, City, PostalCode */
  BVMH_EVENT_LOCAL_ADDRESS = 2, /* a push with Address */
  BVMH_EVENT_NOTIFICATION = 3   /* with Notification and, where there is one, DBType */
} bvmh_event_kind;

typedef struct bvmh_event {
  bvmh_event_kind kind;
  bvmh_region payload; /* a binary property list, a dictionary, as it came: not yet checked */
  uint32_t sender_uid;
  int32_t sender_pid;
  bool wants_reply;    /* bvmh_listener_reply is awaited; the helper waits at most a second for it */
  uint64_t connection; /* the library's, as is what follows */
  uint32_t reply_port;
  int32_t message_id;
  uint64_t reserved[4];
} bvmh_event;

/*
 * Waits for the next push or notification, at most this many milliseconds (negative: for ever), and returns
 * it; the caller frees it with bvmh_event_free. BVMH_ERROR_TIMED_OUT: none arrived; the event is then empty.
 * Messages that break the protocol are answered as the protocol says, and skipped. BVMH_ERROR_NAME_LOST, once
 * for each file: somebody has removed a socket file that bvmh_listener_create made, or its folder. Open
 * connections are still served; for new ones, free the listener and create another.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_next(bvmh_listener* listener, int timeout_ms, bvmh_event* event);
/* Answers a push; error code 0 is success. BVMH_ERROR_NO_LONGER_THERE: the helper no longer waits. */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_reply(bvmh_listener* listener, const bvmh_event* event,
                                                  int32_t error_domain, int32_t error_code);
/*
 * Copies the text under a key of the event's dictionary into the buffer, cut at a character's boundary and
 * closed with a NUL. Returns the text's whole length in bytes, or -1 if the key is absent, its value is not a
 * text, or the payload is not a property list (the buffer then holds the empty text).
 */
BVMH_API ptrdiff_t bvmh_event_text(const bvmh_event* event, const char* key, char* buffer, size_t capacity);
/*
 * Finds the location request of this client that a push answers. A push does not name its request, so the
 * library infers it: if exactly one request of the push's kind was sent in the last ten seconds and has no
 * answer yet, it is that one. BVMH_OK: *call is the number of that call, 0 if it was a blocking one; the
 * request counts as answered. BVMH_ERROR_AMBIGUOUS: there are several; one answer settles them all, so all
 * count as answered. BVMH_ERROR_NOT_ASKED: there is none, for example because another program asked, or the
 * event is not a push. `call` may be NULL.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_match_push(bvmh_client* client, const bvmh_event* event, bvmh_call* call);
BVMH_API void bvmh_event_free(bvmh_event* event);

/* ---- values ---------------------------------------------------------------------------------------------
 */

/*
 * Property lists, the format of preferences, labels, files, pushes and notifications.
 *
 *   bvmh_value* labels = bvmh_value_new_array();
 *   bvmh_value_append(labels, bvmh_value_new_text("USER_LABEL_BUSINESS"));
 *   bvmh_region bytes;
 *   int32_t code = bvmh_value_write(labels, &bytes);
 *   bvmh_value_free(labels);
 *
 * Ownership: the caller owns every bvmh_value* that a function here returns, and must free it or pass it to
 * bvmh_value_append or bvmh_value_set, which take it over whether they succeed or not. Returned texts and
 * bytes belong to the value that they were read from. Every function accepts NULL as a value and treats it
 * like a value of another type.
 *
 * Limits: 512 levels of arrays and dictionaries, and 64 MiB as XML.
 */
typedef struct bvmh_value bvmh_value;

typedef enum bvmh_value_type {
  BVMH_VALUE_NONE = 0, /* NULL */
  BVMH_VALUE_BOOLEAN = 1,
  BVMH_VALUE_INTEGER = 2,
  BVMH_VALUE_REAL = 3,
  BVMH_VALUE_TEXT = 4,
  BVMH_VALUE_DATA = 5,
  BVMH_VALUE_DATE = 6,
  BVMH_VALUE_ARRAY = 7,
  BVMH_VALUE_DICTIONARY = 8
} bvmh_value_type;

/* Return new values; the arguments are copied. NULL: out of memory, a null pointer as argument, or a text
 * that is not UTF-8. */
BVMH_API bvmh_value* bvmh_value_new_boolean(bool value);
BVMH_API bvmh_value* bvmh_value_new_integer(int64_t value);
BVMH_API bvmh_value* bvmh_value_new_unsigned(uint64_t value);
BVMH_API bvmh_value* bvmh_value_new_real(double value);
BVMH_API bvmh_value* bvmh_value_new_text(const char* text);
BVMH_API bvmh_value* bvmh_value_new_data(const void* bytes, size_t size);
/* Seconds since 1970-01-01T00:00:00Z. */
BVMH_API bvmh_value* bvmh_value_new_date(double seconds);
/* Return an empty array or dictionary. */
BVMH_API bvmh_value* bvmh_value_new_array(void);
BVMH_API bvmh_value* bvmh_value_new_dictionary(void);
/* Returns another handle of the same value; later changes of one are not seen in the other. Costs little. */
BVMH_API bvmh_value* bvmh_value_copy(const bvmh_value* value);
BVMH_API void bvmh_value_free(bvmh_value* value);

/* Appends an element. BVMH_ERROR_INVALID_ARGUMENT: not an array, or element is NULL or the array itself;
 * BVMH_ERROR_NO_MEMORY. On failure the array is unchanged. */
BVMH_API int32_t bvmh_value_append(bvmh_value* array, bvmh_value* element);
/* Sets the value under a key and replaces an earlier one. BVMH_ERROR_INVALID_ARGUMENT: not a dictionary, a
 * key that is NULL or not UTF-8, or a value that is NULL or the dictionary itself; BVMH_ERROR_NO_MEMORY. On
 * failure the dictionary is unchanged. */
BVMH_API int32_t bvmh_value_set(bvmh_value* dictionary, const char* key, bvmh_value* value);

BVMH_API bvmh_value_type bvmh_value_type_of(const bvmh_value* value);
/* The number of elements or entries; 0 for other types. */
BVMH_API size_t bvmh_value_count(const bvmh_value* value);
/* Returns the element of an array, or the value of a dictionary's entry, in order. NULL: out of range, or out
 * of memory. */
BVMH_API bvmh_value* bvmh_value_at(const bvmh_value* value, size_t index);
/* The key of a dictionary's entry, in order. NULL: there is none, or out of memory. It lives until the next
 * call with this value. */
BVMH_API const char* bvmh_value_key_at(bvmh_value* dictionary, size_t index);
/* The value under a key. NULL: there is none, or out of memory. */
BVMH_API bvmh_value* bvmh_value_find(const bvmh_value* dictionary, const char* key);

/* If the value has that type and fits, writes *out and returns true. */
BVMH_API bool bvmh_value_get_boolean(const bvmh_value* value, bool* out);
BVMH_API bool bvmh_value_get_integer(const bvmh_value* value, int64_t* out);
BVMH_API bool bvmh_value_get_unsigned(const bvmh_value* value, uint64_t* out);
BVMH_API bool bvmh_value_get_real(const bvmh_value* value, double* out);
/* Seconds since 1970-01-01T00:00:00Z. */
BVMH_API bool bvmh_value_get_date(const bvmh_value* value, double* out);
/* Returns the text, closed with a NUL; NULL: not a text, or out of memory. Writes its length in bytes, NULs
 * inside it included, to *length unless length is NULL. The text lives until the next call with this value.
 */
BVMH_API const char* bvmh_value_get_text(bvmh_value* value, size_t* length);
/* Returns the bytes and writes their number to *size; they live as long as the value. NULL: not data. */
BVMH_API const void* bvmh_value_get_data(const bvmh_value* value, size_t* size);

/* Reads a property list, XML or binary. BVMH_ERROR_NOT_A_VALUE, BVMH_ERROR_NO_MEMORY,
 * BVMH_ERROR_INVALID_ARGUMENT; *value is then NULL. */
BVMH_API BVMH_CHECKED int32_t bvmh_value_read(const void* bytes, size_t size, bvmh_value** value);
/* Writes a binary property list, which every routine accepts. BVMH_ERROR_NOT_A_VALUE: beyond a limit;
 * BVMH_ERROR_NO_MEMORY, BVMH_ERROR_INVALID_ARGUMENT. The region is then empty. */
BVMH_API BVMH_CHECKED int32_t bvmh_value_write(const bvmh_value* value, bvmh_region* bytes);

#ifdef __cplusplus
}
#endif

#endif
