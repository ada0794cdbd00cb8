/* SPDX-License-Identifier: Apache-2.0 */
/* SPDX-FileCopyrightText: The BrenvikMobileHelper authors */
#include <brenvik/mobile_helper.h>
#include <stdio.h>

/* A C program as others write it: prints the country code, or why it cannot, and ends with 1 then. */
int main(int argc, char** argv) {
  bvmh_client* client = bvmh_client_create();
  char country[BVMH_COUNTRY_CODE_SIZE] = "";
  int32_t code = argc > 1 ? bvmh_client_set_socket(client, argv[1]) : BVMH_OK;
  if (code == BVMH_OK) code = bvmh_connect(client);
  if (code == BVMH_OK) code = BVMobileHelperCopyCountryCode(client, country, sizeof country);
  bvmh_client_free(client);
  if (code != BVMH_OK) {
    fprintf(stderr, "%s\n", bvmh_error_text(code));
    return 1;
  }
  printf("%s\n", country);
  return 0;
}
