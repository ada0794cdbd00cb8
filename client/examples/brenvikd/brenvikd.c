/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */

/*
 * The smallest telephony daemon that lives with the helper: it takes over the sockets that the service
 * manager made, asks where the phone is, and prints what it is told. It runs under an account of its own. On
 * SIGUSR1 it asks again, as a real one would when the phone has moved.
 *
 *   cc brenvikd.c -o brenvikd $(pkg-config --cflags --libs brenvik-mobile-helper)
 */
#include <brenvik/mobile_helper.h>
#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>

static int fail(const char* what, int32_t code) {
  fprintf(stderr, "brenvikd: %s: %s\n", what, bvmh_error_text(code));
  return 1;
}

/* The text under a key, or "" when it is absent. */
static const char* text(const bvmh_event* event, const char* key, char* buffer, size_t capacity) {
  (void)bvmh_event_text(event, key, buffer, capacity); /* the buffer then holds the empty text */
  return buffer;
}

static void print(const bvmh_event* event) {
  char first[256], second[256];
  switch (event->kind) {
    case BVMH_EVENT_CIVIC_INFO:
      printf("country \"%s\", city \"%s\"\n", text(event, "CountryCode", first, sizeof first),
             text(event, "City", second, sizeof second));
      break;
    case BVMH_EVENT_LOCAL_ADDRESS:
      printf("address \"%s\"\n", text(event, "Address", first, sizeof first));
      break;
    case BVMH_EVENT_NOTIFICATION:
      printf("notification \"%s\"\n", text(event, "Notification", first, sizeof first));
      break;
    case BVMH_EVENT_NONE:
      break;
  }
  fflush(stdout);
}

static volatile sig_atomic_t has_moved;

static void on_moved(int number) {
  (void)number;
  has_moved = 1;
}

int main(void) {
  /* Messages are taken from root and from our own account only; the library turns others away. */
  bvmh_listener* listener = NULL;
  int32_t code = bvmh_listener_create_from_environment(BVMH_PUSHES | BVMH_NOTIFICATIONS, &listener);
  if (code != BVMH_OK) return fail("no sockets", code);

  /* The channel stays open, because the helper leaves ten seconds after its last client. The question returns
   * at once; its answer is a push. */
  bvmh_client* client = bvmh_client_create();
  if (client == NULL) return fail("no client", BVMH_ERROR_NO_MEMORY);
  code = bvmh_connect(client);
  if (code != BVMH_OK) return fail("the helper does not let us in", code);
  struct sigaction action = {.sa_handler = on_moved};
  sigaction(SIGUSR1, &action, NULL);
  has_moved = 1;

  for (;;) {
    if (has_moved) {
      has_moved = 0;
      /* When the helper has left or was upgraded meanwhile, the library checks in again. */
      code = BVMobileHelperRequestCountryCodeFromLocation(client, 59.9139, 10.7522);
      if (code != BVMH_OK) return fail("could not ask where we are", code);
    }
    /* A real daemon watches this descriptor in its own event loop. */
    struct pollfd ready = {bvmh_listener_fd(listener), POLLIN, 0};
    if (poll(&ready, 1, -1) < 0) {
      if (errno == EINTR) continue;
      fprintf(stderr, "brenvikd: %s\n", strerror(errno));
      return 1;
    }
    bvmh_event event;
    code = bvmh_listener_next(listener, 0, &event);
    if (code == BVMH_ERROR_TIMED_OUT) continue; /* it was nothing for us */
    if (code != BVMH_OK) return fail("cannot listen", code);
    if (event.wants_reply) {
      /* The helper waits a second at most. One that no longer waits is no concern of ours. */
      code = bvmh_listener_reply(listener, &event, 0, 0);
      if (code != BVMH_OK) fprintf(stderr, "brenvikd: %s\n", bvmh_error_text(code));
    }
    print(&event);
    bvmh_event_free(&event);
  }
}
