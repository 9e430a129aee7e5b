/* Compiled as C: the C interface must be usable from C. Returns the step that failed. */
#include <stddef.h>
#include <stdint.h>

#include "qnreporting/qnreporting.h"

int qn_c_api_round_trip(const char* socket_path) {
  char error[128];
  qn_client* client = qn_client_connect(socket_path, error, sizeof error);
  int64_t found = -1;
  uint16_t type = 0;
  int64_t ids[2] = {0, 0};
  size_t count = 0;
  const int64_t targets[1] = {42};
  int step = 0;
  if (client == NULL) return 1;
  if (qn_client_create_session(client, 42, 0) != 0)
    step = 2;
  else if (qn_client_set_service_type(client, 42, 2, 0) != 0)
    step = 3;
  else if (qn_client_set_configuration(client, 42, "{\"a\": [1, 2]}", 0) != 0)
    step = 4;
  else if (qn_client_set_configuration(client, 42, "[1]", 0) != QN_BAD_ARGUMENT)
    step = 5;
  else if (qn_client_start_session(client, 42) != 0)
    step = 6;
  else if (qn_client_send_message(client, "{\"route\": \"speaker\"}", 5, 1, targets, 1, 0) != 0)
    step = 7;
  else if (qn_client_send_message(client, "{}", 1, 1, NULL, 0, 0) != QN_REPORTING_DISABLED)
    step = 8;
  else if (qn_client_get_service_type(client, 9, &type, 0) != 0 || type != 9)
    step = 9;
  else if (qn_client_reporter_id_valid(client, 42, &found, &type, 0) != 0 || found != 42 ||
           type != 7)
    step = 10;
  else if (qn_client_get_all_reporters(client, ids, 2, &count, 0) != 0 || count != 3 ||
           ids[0] != 1 || ids[1] != 2)
    step = 11;
  else if (qn_client_stop_session(client, 42, 0) != 0)
    step = 12;
  else if (qn_client_destroy_session(client, 42, 0) != 0)
    step = 13;
  else if (qn_client_kill_service(client) != 0)
    step = 14;
  else if (!qn_client_connected(client))
    step = 15;
  qn_client_free(client);
  return step;
}
