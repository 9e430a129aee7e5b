/* libqnreporting: a C interface to the quenta reporting service, on top of the C++ client
 * (qnreporting/Client.h). Every call blocks until its reply arrives or `timeout_ms` passes
 * (timeout_ms <= 0: ten seconds), except qn_client_start_session and qn_client_kill_service,
 * which only send. A client may be used from several threads at once.
 *
 * Return values: 0 on success; QN_NO_REPLY when no reply came in time or the connection
 * has ended; QN_BAD_ARGUMENT for an invalid argument (bad JSON, a null pointer). */
#ifndef QNREPORTING_QNREPORTING_H_
#define QNREPORTING_QNREPORTING_H_

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define QN_NO_REPLY (-1)
#define QN_BAD_ARGUMENT (-2)
#define QN_REPORTING_DISABLED 1 /* qn_client_send_message: the service refused the message */

typedef struct qn_client qn_client;

/* Connects to the service at `socket_path` (NULL: the default socket of this user). On
 * failure returns NULL and, when `error` is not NULL, writes a description (at most
 * `error_size` bytes, NUL-terminated) there. Free the client with qn_client_free. */
qn_client* qn_client_connect(const char* socket_path, char* error, size_t error_size);

/* Closes the connection and frees the client. NULL is ignored. */
void qn_client_free(qn_client* client);

/* Whether the connection is still open (1) or has ended (0). */
int qn_client_connected(const qn_client* client);

int qn_client_create_session(qn_client* client, int64_t reporter_id, int timeout_ms);
int qn_client_set_service_type(qn_client* client, int64_t reporter_id, uint16_t service_type,
                               int timeout_ms);
/* `configuration_json`: a JSON object. */
int qn_client_set_configuration(qn_client* client, int64_t reporter_id,
                                const char* configuration_json, int timeout_ms);
/* Sends the start request. Its reply comes only when the session is stopped or started
 * again, so this call does not wait for it. */
int qn_client_start_session(qn_client* client, int64_t reporter_id);
int qn_client_stop_session(qn_client* client, int64_t reporter_id, int timeout_ms);
int qn_client_destroy_session(qn_client* client, int64_t reporter_id, int timeout_ms);

/* Sends `message_json` (a JSON object) with its category and type to the sessions in
 * `reporter_ids` (`count` of them), or to every started session when `reporter_ids` is
 * NULL. Returns 0, QN_REPORTING_DISABLED when the service refused it, or a negative
 * value as above. */
int qn_client_send_message(qn_client* client, const char* message_json, uint32_t category,
                           uint16_t type, const int64_t* reporter_ids, size_t count,
                           int timeout_ms);

/* The session's service type (65535 when no session has this ID). For ID 0 the service
 * replies twice; this returns the second reply. */
int qn_client_get_service_type(qn_client* client, int64_t reporter_id, uint16_t* service_type,
                               int timeout_ms);
/* The reporterID:valid: reply: the ID (0 when unknown) and its service type. */
int qn_client_reporter_id_valid(qn_client* client, int64_t reporter_id, int64_t* found_id,
                                uint16_t* service_type, int timeout_ms);
/* Writes up to `capacity` reporter IDs of every client's sessions to `ids` and their total
 * number to `*count` (which may exceed `capacity`). */
int qn_client_get_all_reporters(qn_client* client, int64_t* ids, size_t capacity, size_t* count,
                                int timeout_ms);
/* Asks the service to exit. There is no reply. */
int qn_client_kill_service(qn_client* client);

#ifdef __cplusplus
}
#endif

#endif /* QNREPORTING_QNREPORTING_H_ */
