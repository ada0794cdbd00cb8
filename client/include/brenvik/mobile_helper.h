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
 * Threads: an object (client or listener) may be used by one thread at a time, any thread; different
 * objects are independent. Nothing here touches signals, the working directory or the environment; SIGPIPE is
 * never raised, every descriptor is close-on-exec. After fork() only one of the two processes may go on
 * using an object.
 *
 * Texts are UTF-8 and end with a NUL. Paths are read by the helper, in its own working directory and under
 * its own account: give absolute ones.
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

/* ---- results ------------------------------------------------------------------------------------------- */

/*
 * Every function that can fail returns an int32_t: 0, a code that the helper answered (kernel-style codes,
 * positive, and message-layer codes, -300 to -309; codes not listed here pass through), or a failure
 * of the transport, BVMH_ERROR_*, from -7099 to -7001. The helper never answers with a code of that
 * last range: an answer that claims one is BVMH_ERROR_PROTOCOL.
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

/* What a code means, in English, without a full stop. Never NULL; lives for ever. */
BVMH_API const char* bvmh_error_text(int32_t code);

/* ---- the client ---------------------------------------------------------------------------------------- */

typedef struct bvmh_client bvmh_client;

#define BVMH_DEFAULT_TIMEOUT_MS 30000u

/* Sizes of buffers for texts that the helper returns, in bytes, the closing NUL included. */
#define BVMH_TOKEN_SIZE 257
#define BVMH_COUNTRY_CODE_SIZE 65

/* A client that is not connected yet. NULL: out of memory. */
BVMH_API bvmh_client* bvmh_client_create(void);
/* Leaves the helper and frees the client; the helper then drops what it kept for it. NULL is allowed. */
BVMH_API void bvmh_client_free(bvmh_client* client);

/*
 * How long one call may take in all, in milliseconds, from now on; connecting, sending and retries included.
 * 0 stands for the default, BVMH_DEFAULT_TIMEOUT_MS.
 */
BVMH_API void bvmh_client_set_timeout(bvmh_client* client, uint32_t milliseconds);
/*
 * Where the helper's service socket is, for the next connect; for tests. NULL stands for the place compiled
 * in, bvmh_service_socket(). The text is copied.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_client_set_socket(bvmh_client* client, const char* path);
BVMH_API const char* bvmh_service_socket(void);
/* The folder of named services that was compiled in. */
BVMH_API const char* bvmh_bootstrap_directory(void);

/*
 * Connects to the helper and checks in; it does nothing when that was done already. When the helper stopped
 * before it answered, it is tried again, for about a second and never beyond the time-out.
 * BVMH_INVALID_SECURITY: the helper refused this program. With EACCES in bvmh_client_errno the kernel did:
 * the account must join the group that may connect ("brenvik"; usermod -aG brenvik ACCOUNT), log in anew, and
 * then be entitled. BVMH_ERROR_UNREACHABLE: no helper.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_connect(bvmh_client* client);
/* Leaves the helper. Answers still to come are lost. */
BVMH_API void bvmh_disconnect(bvmh_client* client);
/* bvmh_disconnect, then bvmh_connect. */
BVMH_API BVMH_CHECKED int32_t bvmh_reconnect(bvmh_client* client);
/* The errno behind the last BVMH_ERROR_UNREACHABLE or BVMH_ERROR_SYSTEM of this client, EACCES behind a
 * BVMH_INVALID_SECURITY of the kernel's; else 0. */
BVMH_API int bvmh_client_errno(const bvmh_client* client);

/*
 * A region of bytes that a routine returned. The caller owns it and frees it with bvmh_region_free.
 * bytes is NULL, and size 0, when there is no value. The bytes are not followed by a NUL.
 */
typedef struct bvmh_region {
  const void* bytes;
  size_t size;
  void* owner; /* the library's */
} bvmh_region;

/* Frees the bytes and makes the region empty. NULL and an empty region are allowed. */
BVMH_API void bvmh_region_free(bvmh_region* region);

/* ---- routines ------------------------------------------------------------------------------------------ */

/*
 * One function a routine. Each sends one request and waits for its answer, at most the client's time-out.
 * After BVMH_ERROR_TIMED_OUT the client stays usable; a late answer is recognised and dropped. When the
 * helper has left since the last call, a routine checks in again, once, and only while its request has
 * certainly not been carried out; a request that may have been carried out is never sent twice. Out-values
 * are written on BVMH_OK only, except regions, which are made empty first.
 */

/* Voicemail. Keys and tokens: at most 255 bytes. A buffer for a token has at least BVMH_TOKEN_SIZE bytes; a
 * token that was never set is the empty text. */
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
 * exactly one byte, whatever the byte, removes the key. BVMH_FAILURE: the bytes are no property list, or too
 * large a one; nothing was changed. BVMH_OK is the answer, too, when the value is too deep, the disk did not
 * take it, or the domain names no file (it is empty, "." or "..", or holds a slash): the helper's log says so
 * then. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperSetPreferenceValue(bvmh_client* client, const char* domain,
                                                               const char* key, const void* value,
                                                               size_t length);
/* Returns the value as an XML property list; an empty region when there is none. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyPreferenceValue(bvmh_client* client, const char* domain,
                                                                const char* key, bvmh_region* value);
/* The same in application scope, which also looks at this host's and every user's values. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCopyAppPreferenceValue(bvmh_client* client, const char* domain,
                                                                   const char* key, bvmh_region* value);
/* Reads a property-list file whose top level is a dictionary (at most 255 bytes of path) and returns it as
 * XML. BVMH_MEMORY_FAILURE: it cannot be read, or is something else. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperLoadPlistFile(bvmh_client* client, const char* path,
                                                          bvmh_region* plist);

/* Carrier files. Paths and domains of the first three: at most 1023 bytes, of the others 255. */

/* Replaces one of the known carrier links by a link to target, then drops cached values of the preference
 * domain ("" for none). BVMH_NO_ACCESS: link_path is not one of them, or is a directory. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperReplaceCarrierSymlink(bvmh_client* client, const char* target,
                                                                  const char* link_path, const char* domain);
/* Replaces whatever file stands at link_path by a link to target. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCreateSymlink(bvmh_client* client, const char* target,
                                                          const char* link_path);
/* Drops cached values of the domain ("" for none), then removes a carrier file or an empty folder. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRemoveCarrierFile(bvmh_client* client, const char* path,
                                                              const char* domain);
/* The next four return BVMH_OK also when the work failed, and say in *success which; the helper's log has the
 * reason. */
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

/* Degrees; both exactly 0 stand for "no position": the push then holds the configured country only. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRequestCountryCodeFromLocation(bvmh_client* client,
                                                                           double latitude, double longitude);
BVMH_API BVMH_CHECKED int32_t BVMobileHelperRequestWanIPFromLocation(bvmh_client* client);
/* The country code known now, "" when none. The buffer has at least BVMH_COUNTRY_CODE_SIZE bytes. */
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

/* Non-zero: one echo every two seconds over the cellular interface, and the helper stays; 0: off. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCellularHeartbeat(bvmh_client* client, int32_t value);

enum { BVMH_LASD_UMTS = 1, BVMH_LASD_CDMA = 2, BVMH_LASD_LTE = 4, BVMH_LASD_GSM = 8, BVMH_LASD_SCDMA = 16 };
/* Starts an update check of the databases whose BVMH_LASD_* bits are set; the outcome arrives as
 * notifications, see bvmh_listener. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperCheckLASDUpdate(bvmh_client* client, int32_t value);

/* Non-zero: the radio manager logs to a file; 0: it does not. */
BVMH_API BVMH_CHECKED int32_t BVMobileHelperEnableRadioManagerLogs(bvmh_client* client, int32_t enable);

/* ---- pushes and notifications -------------------------------------------------------------------------- */

/* The telephony daemon's side: serves its two named services, on which the helper reports. */
typedef struct bvmh_listener bvmh_listener;

enum { BVMH_PUSHES = 1, BVMH_NOTIFICATIONS = 2 };

/*
 * Listens on the services whose bits are set, in the given folder (NULL: the one compiled in), which is
 * made when it is not there. A socket file that nobody serves any more is replaced. Messages are taken from
 * the superuser and from this process's own user only; anyone else's connection is closed at once.
 * BVMH_ERROR_SYSTEM leaves the reason in errno.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_create(const char* directory, unsigned services,
                                                   bvmh_listener** listener);
/*
 * Listens on sockets that somebody else made: for a daemon that may not write the folder of named services.
 * Each is a listening AF_UNIX socket of type SOCK_SEQPACKET, or -1 for a service that is not wanted; at least
 * one is given. On BVMH_OK both descriptors are the listener's: they become non-blocking and close-on-exec,
 * and are closed with it; their socket files stay. On any other result they stay the caller's.
 * BVMH_ERROR_INVALID_ARGUMENT: one of them is no such socket, or both are the same.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_create_from_fds(int pushes, int notifications,
                                                            bvmh_listener** listener);
/*
 * The same with the sockets that the service manager handed to this process (LISTEN_PID, LISTEN_FDS and
 * LISTEN_FDNAMES, as sd_listen_fds(3) describes them), found by name: "com.norvale.brenvik" for pushes,
 * "com.norvale.Brenvik.lasd" for notifications. Takes what is there of the services whose bits are set;
 * descriptors with other names are left alone. BVMH_ERROR_NOT_HANDED_OVER: there is neither of them. Reads
 * the environment and leaves it as it is; may be called once.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_create_from_environment(unsigned services,
                                                                    bvmh_listener** listener);
/* Takes messages from one more user, for a helper that runs under an account of its own. */
BVMH_API void bvmh_listener_allow_uid(bvmh_listener* listener, uint32_t uid);
/* Stops listening and removes the socket files that bvmh_listener_create made. NULL is allowed. */
BVMH_API void bvmh_listener_free(bvmh_listener* listener);
/* A descriptor that is readable when bvmh_listener_next has something to do; the listener's own. */
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
  uint64_t connection; /* the library's, as are the next two */
  uint32_t reply_port;
  int32_t message_id;
} bvmh_event;

/*
 * Waits for the next push or notification, at most so many milliseconds (negative: for ever), and hands it
 * over; the caller frees it with bvmh_event_free. BVMH_ERROR_TIMED_OUT when none came; the event is
 * then empty. Messages that break the protocol are answered as the protocol says, and skipped.
 */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_next(bvmh_listener* listener, int timeout_ms, bvmh_event* event);
/* Answers a push: error code 0 is success. BVMH_ERROR_NO_LONGER_THERE when the helper no longer waits. */
BVMH_API BVMH_CHECKED int32_t bvmh_listener_reply(bvmh_listener* listener, const bvmh_event* event,
                                                  int32_t error_domain, int32_t error_code);
/*
 * The text under a key of the event's dictionary, cut to the buffer at a character's boundary and closed with
 * a NUL. Returns the text's whole length in bytes, or -1 when the key is absent, is no text, or the payload
 * is not a property list (the buffer then holds the empty text).
 */
BVMH_API ptrdiff_t bvmh_event_text(const bvmh_event* event, const char* key, char* buffer, size_t capacity);
BVMH_API void bvmh_event_free(bvmh_event* event);

#ifdef __cplusplus
}
#endif

#endif
