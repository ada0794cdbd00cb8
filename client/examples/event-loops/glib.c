/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */

/*
 * Calls that do not block, in a program whose event loop is GLib's: it checks in, asks for the country code
 * and for the general voicemail token at the same time, prints both, and ends.
 *
 *   cc glib.c -o glib $(pkg-config --cflags --libs brenvik-mobile-helper glib-2.0)
 */
#include <brenvik/mobile_helper.h>
#include <glib-unix.h>
#include <stdio.h>

struct program {
  GMainLoop* loop;
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

static gboolean ready(gint fd, GIOCondition condition, gpointer data) {
  struct program* program = data;
  bvmh_result result;
  (void)fd, (void)condition;
  bvmh_process(program->client);
  while (bvmh_take_result(program->client, 0, &result) == BVMH_OK) {
    finished(program, &result);
    bvmh_result_free(&result);
  }
  if (program->awaited == 0) g_main_loop_quit(program->loop);
  return G_SOURCE_CONTINUE;
}

int main(int argc, char** argv) {
  struct program program = {g_main_loop_new(NULL, FALSE), bvmh_client_create(), 0, 0};
  if (argc > 1 && bvmh_client_set_socket(program.client, argv[1]) != BVMH_OK) return 2;

  int fd = bvmh_client_fd(program.client);
  if (fd < 0) {
    fprintf(stderr, "no client\n");
    return 2;
  }
  guint source = g_unix_fd_add(fd, G_IO_IN, ready, &program);
  /* The two questions wait for the check-in; all three are under way at once. */
  int32_t code = bvmh_begin_connect(program.client, connecting, NULL);
  if (code == BVMH_OK) code = BVMobileHelperCopyCountryCodeBegin(program.client, country, NULL);
  if (code == BVMH_OK) code = BVMobileHelperCopyVoicemailTokenBegin(program.client, token, NULL);
  if (code != BVMH_OK) {
    fprintf(stderr, "%s\n", bvmh_error_text(code));
    return 2;
  }
  program.awaited = 3;

  g_main_loop_run(program.loop);
  g_source_remove(source);
  g_main_loop_unref(program.loop);
  bvmh_client_free(program.client);
  return program.status;
}
