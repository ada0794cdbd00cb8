/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */

/*
 * Values without any XML: stores a dictionary as a preference, reads it back and prints it.
 *
 *   cc preferences.c -o preferences $(pkg-config --cflags --libs brenvik-mobile-helper)
 */
#include <brenvik/mobile_helper.h>
#include <inttypes.h>
#include <stdio.h>

#define DOMAIN "com.example.preferences"

static int fail(const char* what, int32_t code) {
  fprintf(stderr, "%s: %s\n", what, bvmh_error_text(code));
  return 1;
}

/* {"Carrier": "Example", "Version": 7, "Bands": [1, 3, 20]} */
static bvmh_value* made(void) {
  static const int bands[] = {1, 3, 20};
  bvmh_value* list = bvmh_value_new_array();
  bvmh_value* dictionary = bvmh_value_new_dictionary();
  int32_t code = BVMH_OK;
  for (size_t i = 0; code == BVMH_OK && i < sizeof bands / sizeof *bands; ++i)
    code = bvmh_value_append(list, bvmh_value_new_integer(bands[i]));
  if (code == BVMH_OK) code = bvmh_value_set(dictionary, "Carrier", bvmh_value_new_text("Example"));
  if (code == BVMH_OK) code = bvmh_value_set(dictionary, "Version", bvmh_value_new_integer(7));
  if (code != BVMH_OK) {
    bvmh_value_free(list);
    bvmh_value_free(dictionary);
    return NULL;
  }
  /* From here on the list is the dictionary's, whatever the answer is. */
  if (bvmh_value_set(dictionary, "Bands", list) == BVMH_OK) return dictionary;
  bvmh_value_free(dictionary);
  return NULL;
}

static void print(const bvmh_value* preference) {
  bvmh_value* carrier = bvmh_value_find(preference, "Carrier");
  bvmh_value* bands = bvmh_value_find(preference, "Bands");
  const char* text = bvmh_value_get_text(carrier, NULL); /* NULL when it is absent or no text */
  printf("carrier %s, bands", text == NULL ? "unknown" : text);
  for (size_t i = 0; i < bvmh_value_count(bands); ++i) {
    bvmh_value* band = bvmh_value_at(bands, i);
    int64_t number = 0;
    if (bvmh_value_get_integer(band, &number)) printf(" %" PRId64, number);
    bvmh_value_free(band);
  }
  printf("\n");
  bvmh_value_free(bands);
  bvmh_value_free(carrier);
}

int main(int argc, char** argv) {
  bvmh_client* client = bvmh_client_create();
  int32_t code = argc > 1 ? bvmh_client_set_socket(client, argv[1]) : BVMH_OK;
  if (code == BVMH_OK) code = bvmh_connect(client);
  if (code != BVMH_OK) return fail("connect", code);

  bvmh_value* value = made();
  bvmh_region bytes;
  code = bvmh_value_write(value, &bytes);
  bvmh_value_free(value);
  if (code != BVMH_OK) return fail("write", code);
  code = BVMobileHelperSetPreferenceValue(client, DOMAIN, "Settings", bytes.bytes, bytes.size);
  bvmh_region_free(&bytes);
  if (code != BVMH_OK) return fail("set", code);

  code = BVMobileHelperCopyPreferenceValue(client, DOMAIN, "Settings", &bytes);
  if (code != BVMH_OK) return fail("get", code);
  code = bvmh_value_read(bytes.bytes, bytes.size, &value);
  bvmh_region_free(&bytes);
  if (code != BVMH_OK) return fail("read", code);
  print(value);
  bvmh_value_free(value);
  bvmh_client_free(client);
  return 0;
}
