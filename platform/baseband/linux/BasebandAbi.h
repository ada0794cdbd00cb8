// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

/*
 * What a baseband helper library exports so that this helper can host its server. A C header, to be included
 * by such a library; every function has C linkage and must not let an exception out.
 *
 * The library is named at build time (BRENVIK_BASEBAND_LIBRARY) and found as dlopen(3) finds it. It is
 * optional: where it, or any one of these functions, is absent, no server is hosted. Once loaded it stays
 * loaded until the process ends. All functions are called on the main thread; what the library starts on
 * threads of its own is its own affair, but Stop must have ended it when it returns.
 *
 * Order of calls: CanHost; when that gave non-zero, Create; when that gave a server, Start, then IsBusy any
 * number of times (every 10 seconds while nobody else uses the helper), Stop once, Release once. A server
 * that was created is always released; one that was started is always stopped first.
 */

#ifdef __cplusplus
extern "C" {
#endif

/* Non-zero when this system has a baseband whose server should be hosted. */
int BrenvikBasebandCanHost(void);

/* A server, not started; NULL when there is to be none. The log server is borrowed until Release; NULL (all
 * that the helper ever passes) means that the library logs as it likes. */
void* BrenvikBasebandServerCreate(void* logServer);

void BrenvikBasebandServerStart(void* server);

/* Non-zero keeps the helper alive for ten more seconds. */
int BrenvikBasebandServerIsBusy(void* server);

void BrenvikBasebandServerStop(void* server);

/* Frees the server. */
void BrenvikBasebandServerRelease(void* server);

#ifdef __cplusplus
}
#endif
