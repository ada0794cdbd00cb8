/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */

/*
 * Calls that do not block, in a program whose event loop is sd-event: it checks in, asks for the country code
 * and for the general voicemail token at the same time, prints both, and ends.
 *
 *   cc sd-event.c -o sd-event $(pkg-config --cflags --libs brenvik-mobile-helper libsystemd)
 */
#include <brenvik/mobile_helper.h>
#include <stdio.h>
#include <string.h>
#include <sys/epoll.h>
#include <systemd/sd-event.h>

struct program {
  sd_event* loop;
  bvmh_client* client;
  int awaited; /* results still to come */
  int status;
};

/* What the calls are for; handed back in their results. */
static char connecting[] = "check-in", country[] = "country", token[] = "token";

static void finished(struct program* program, const bvmh_result* result) {
  const char* what = result->context;
  --program->awaited;
  if (result->code != BVMH_OK) {
    fprintf(stderr, "%s: %s\n", what, bvmh_error_text(result->code));
    program->status = 1;
  } else if (result->context != connecting) {
    printf("%s: \"%s\"\n", what, result->text);
  }
}

static int ready(sd_event_source* source, int fd, uint32_t events, void* data) {
  struct program* program = data;
  bvmh_result result;
  (void)source, (void)fd, (void)events;
  bvmh_process(program->client);
  while (bvmh_take_result(program->client, 0, &result) == BVMH_OK) {
    finished(program, &result);
    bvmh_result_free(&result);
  }
  return program->awaited == 0 ? sd_event_exit(program->loop, program->status) : 0;
}

int main(int argc, char** argv) {
  struct program program = {NULL, bvmh_client_create(), 0, 0};
  if (argc > 1 && bvmh_client_set_socket(program.client, argv[1]) != BVMH_OK) return 2;

  int fd = bvmh_client_fd(program.client);
  if (fd < 0 || sd_event_default(&program.loop) < 0 ||
      sd_event_add_io(program.loop, NULL, fd, EPOLLIN, ready, &program) < 0) {
    fprintf(stderr, "no event loop\n");
    return 2;
  }
  /* The two questions wait for the check-in; all three are under way at once. */
  int32_t code = bvmh_begin_connect(program.client, connecting, NULL);
  if (code == BVMH_OK) code = BVMobileHelperCopyCountryCodeBegin(program.client, country, NULL);
  if (code == BVMH_OK) code = BVMobileHelperCopyVoicemailTokenBegin(program.client, token, NULL);
  if (code != BVMH_OK) {
    fprintf(stderr, "%s\n", bvmh_error_text(code));
    return 2;
  }
  program.awaited = 3;

  int status = sd_event_loop(program.loop);
  sd_event_unref(program.loop);
  bvmh_client_free(program.client);
  return status;
}
