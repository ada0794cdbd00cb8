// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

/*
 * The functions that a baseband helper library exports so that this helper can host its server. The library
 * includes this C header. Every function has C linkage and must not let an exception out.
 *
 * The library's name is set at build time (BRENVIK_BASEBAND_LIBRARY), and dlopen(3) finds the file. It is
 * optional: if the library or any one of these functions is absent, no server is hosted. Once loaded, it
 * stays loaded until the process ends. All functions are called on the main thread. The library may start
 * threads of its own, but they must have ended when Stop returns.
 *
 * Order of calls: CanHost; if it returned non-zero, Create; if that returned a server, Start once, IsBusy any
 * number of times (every 10 seconds while nobody else uses the helper), Stop once, Release once. A server
 * that was created is always released; a server that was started is always stopped first.
 */

#ifdef __cplusplus
extern "C" {
#endif

/* Returns non-zero if this system has a baseband whose server should be hosted. */
int BrenvikBasebandCanHost(void);

/* Makes a server, which is not started yet, or returns NULL to host none. The log server is borrowed until
 * Release; NULL, which is all the helper ever passes, means that the library logs as it likes. */
void* BrenvikBasebandServerCreate(void* logServer);

void BrenvikBasebandServerStart(void* server);

/* Returns non-zero to keep the helper alive for ten more seconds. */
int BrenvikBasebandServerIsBusy(void* server);

void BrenvikBasebandServerStop(void* server);

/* Frees the server. */
void BrenvikBasebandServerRelease(void* server);

#ifdef __cplusplus
}
#endif
