/* A small C client of the reporting service: creates a session, configures it, sends a message
 * to it, checks it and destroys it again. Usage: sxreporting_example [SOCKET] [REPORTER_ID]
 * (the default socket when none is given). Exit status 0 when every step got its reply. */
#include <inttypes.h>
#include <stdio.h>
#include <stdlib.h>

#include "sxreporting/sxreporting.h"

/* Five seconds is plenty for operations that reply at once. */
#define TIMEOUT_MS 5000

static int check(sxr_client* client, const char* step, sxr_status status) {
  if (status == SXR_OK) return 1;
  fprintf(stderr, "%s: %s: %s\n", step, sxr_status_name(status), sxr_client_last_error(client));
  return 0;
}

static int run(sxr_client* client, int64_t id) {
  bool ok = false;
  if (!check(client, "create", sxr_create_reporting_session(client, id, TIMEOUT_MS, &ok))) {
    return 0;
  }
  printf("create: %s\n", ok ? "true" : "false");

  /* 2: telephony. */
  if (!check(client, "set-type", sxr_set_service_type(client, 2, id, TIMEOUT_MS, &ok))) return 0;
  printf("set-type: %s\n", ok ? "true" : "false");

  const char* configuration = "{\"HostApplicationDisplayID\": \"c-example\"}";
  if (!check(client, "configure",
             sxr_set_configuration(client, configuration, id, TIMEOUT_MS, &ok))) {
    return 0;
  }
  printf("configure: %s\n", ok ? "true" : "false");

  /* Category 3, type 1: a playback start. The session is not started, so nothing records it,
   * but the service still takes the message. */
  bool delivered = false;
  const int64_t ids[] = {id};
  if (!check(client, "send",
             sxr_send_message(client, "{\"event\": \"route\", \"value\": 3}", 3, 1, ids, 1,
                              TIMEOUT_MS, &delivered))) {
    return 0;
  }
  printf("send: %s\n", delivered ? "delivered" : "not delivered (reporting is disabled)");

  int64_t validID = 0;
  uint16_t type = 0;
  if (!check(client, "valid", sxr_reporter_id_valid(client, id, TIMEOUT_MS, &validID, &type))) {
    return 0;
  }
  printf("valid: reporterID %" PRId64 ", serviceType %u\n", validID, (unsigned)type);

  int64_t* all = NULL;
  size_t count = 0;
  if (!check(client, "list", sxr_get_all_reporters(client, TIMEOUT_MS, &all, &count))) return 0;
  printf("list:");
  for (size_t i = 0; i < count; ++i) printf(" %" PRId64, all[i]);
  printf("\n");
  sxr_free(all);

  if (!check(client, "destroy", sxr_destroy_reporting_session(client, id, TIMEOUT_MS, &ok))) {
    return 0;
  }
  printf("destroy: %s\n", ok ? "true" : "false");
  return 1;
}

int main(int argc, char** argv) {
  const char* socket = argc > 1 ? argv[1] : NULL;
  const int64_t id = argc > 2 ? strtoll(argv[2], NULL, 10) : 42;

  sxr_client* client = NULL;
  sxr_status status = sxr_client_connect(socket, &client);
  if (status != SXR_OK) {
    fprintf(stderr, "connect: %s\n", sxr_client_last_error(client));
    sxr_client_close(client);
    return 2;
  }
  const int ok = run(client, id);
  sxr_client_close(client);
  return ok ? 0 : 1;
}
