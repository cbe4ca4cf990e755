/* sxreporting.h: the C interface of the reporting service client library (libsxreporting).
 *
 * A plain C11 API over the same connection as the C++ SXReportingClient (client.h): one
 * function per protocol operation, each blocking its calling thread until the service replies,
 * the call's time-out passes or the connection ends. Nothing but C types crosses this
 * interface and no C++ exception leaves it.
 *
 * Values: reporter IDs are int64_t (0 names no session), service types uint16_t (65535 means
 * "unknown" in replies), categories uint32_t, message types uint16_t. Messages and
 * configurations are JSON text (a JSON object; a configuration may also be NULL or "null" for
 * none), because their values are free-form dictionaries and JSON is what every C program can
 * produce. A message or configuration that is not a JSON object, or is nested deeper than 32
 * levels, is refused with SXR_ERROR and never sent.
 *
 * Results: every operation returns an sxr_status and stores its reply through out-parameters,
 * which are written only on SXR_OK and may be NULL when the caller does not want the value.
 * When a call does not return SXR_OK, sxr_client_last_error() says why.
 *
 * Time-outs: every operation takes `timeout_ms`: a positive number of milliseconds,
 * SXR_TIMEOUT_DEFAULT (0) for the client's default of 5 seconds, or SXR_WAIT_FOREVER (any
 * negative number) for no limit. Some operations never reply by design (reporter ID 0 for
 * set-service-type, stop and destroy; starting a session that is already started;
 * sxr_kill_service), and a start replies only when its session stops, so waiting forever is
 * rarely what a caller wants.
 *
 * Threads: one sxr_client may be used from any number of threads at once; calls from
 * different threads are in flight together on the one connection and each blocks only its own
 * thread. The last error is kept per client and per thread, so a thread always reads the
 * outcome of its own last call. sxr_client_close() must not race with other calls on the same
 * client: call it once every other thread is done with the client.
 *
 * Memory: strings and arrays the library returns through out-parameters belong to the caller,
 * who releases them with sxr_free().
 */
#ifndef SXREPORTING_SXREPORTING_H_
#define SXREPORTING_SXREPORTING_H_

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* A connection to the reporting service. Opaque; made by sxr_client_connect, released by
 * sxr_client_close. */
typedef struct sxr_client sxr_client;

typedef enum sxr_status {
  SXR_OK = 0,              /* the service replied; the out-parameters hold the reply */
  SXR_TIMEOUT = 1,         /* no reply within the call's time-out (it may never come) */
  SXR_CONNECTION_LOST = 2, /* no connection, or it ended before the reply came */
  SXR_ERROR = 3,           /* a bad argument, a request the service rejected, a reply that
                              made no sense, or memory ran out */
} sxr_status;

#define SXR_TIMEOUT_DEFAULT 0
#define SXR_WAIT_FOREVER (-1)

/* The service type reported for a reporter ID that names no session. */
#define SXR_SERVICE_TYPE_UNKNOWN 65535

/* Connects to the service's Unix socket at `socket_path`; NULL or "" means the default path
 * ($SXREPORTING_SOCKET, else the runtime directory's socket). Blocks until connected.
 * Stores a client in *out_client even when connecting fails, so that sxr_client_last_error
 * can say why; the caller closes it either way. *out_client is NULL only when memory ran out.
 * Returns SXR_OK, SXR_CONNECTION_LOST (nothing listens there) or SXR_ERROR. */
sxr_status sxr_client_connect(const char* socket_path, sxr_client** out_client);

/* Ends the connection and releases the client. NULL is allowed and does nothing. */
void sxr_client_close(sxr_client* client);

/* Why the calling thread's last call on `client` did not return SXR_OK; "" after a call that
 * did. The text stays valid until this thread's next call on the client, or its close. With a
 * NULL client: why sxr_client_connect could not make a client. */
const char* sxr_client_last_error(const sxr_client* client);

/* The socket path the client connects to (the default resolved). */
const char* sxr_client_socket_path(const sxr_client* client);

/* "ok", "timeout", "connection lost" or "error". */
const char* sxr_status_name(sxr_status status);

/* Releases a string or array returned by this library. NULL is allowed. */
void sxr_free(void* pointer);

/* --- The operations, in protocol order. */

/* createReportingSession: replies true. */
sxr_status sxr_create_reporting_session(sxr_client* client, int64_t reporter_id, int64_t timeout_ms,
                                        bool* out_result);

/* setServiceType: replies true for any non-zero reporter ID; never replies for 0. */
sxr_status sxr_set_service_type(sxr_client* client, uint16_t service_type, int64_t reporter_id,
                                int64_t timeout_ms, bool* out_result);

/* getServiceNameForReporterID: the session's service type, SXR_SERVICE_TYPE_UNKNOWN when no
 * session has the ID. */
sxr_status sxr_get_service_name_for_reporter_id(sxr_client* client, int64_t reporter_id,
                                                int64_t timeout_ms, uint16_t* out_service_type);

/* setConfiguration: `configuration_json` is a JSON object, or NULL / "null" to clear the
 * session's configuration. Replies true. */
sxr_status sxr_set_configuration(sxr_client* client, const char* configuration_json,
                                 int64_t reporter_id, int64_t timeout_ms, bool* out_result);

/* startReportingSessionForID: replies false at once when there is no such session, else true
 * when the session stops. Never replies for reporter ID 0 or a session already started. */
sxr_status sxr_start_reporting_session_for_id(sxr_client* client, int64_t reporter_id,
                                              int64_t timeout_ms, bool* out_result);

/* sendMessage: `message_json` is a JSON object. `reporter_ids` names the sessions
 * (`reporter_id_count` of them, 0 sends to none); NULL sends to every started session, and
 * then `reporter_id_count` must be 0. *out_delivered is true when the service took the message
 * and false when it replied with its error because reporting is disabled. */
sxr_status sxr_send_message(sxr_client* client, const char* message_json, uint32_t category,
                            uint16_t type, const int64_t* reporter_ids, size_t reporter_id_count,
                            int64_t timeout_ms, bool* out_delivered);

/* stopReportingSessionForID: replies true for any non-zero reporter ID; never replies for 0. */
sxr_status sxr_stop_reporting_session_for_id(sxr_client* client, int64_t reporter_id,
                                             int64_t timeout_ms, bool* out_result);

/* destroyReportingSession: replies true for any non-zero reporter ID; never replies for 0. */
sxr_status sxr_destroy_reporting_session(sxr_client* client, int64_t reporter_id,
                                         int64_t timeout_ms, bool* out_result);

/* reporterID:valid: the session's reporter ID and service type, or 0 and
 * SXR_SERVICE_TYPE_UNKNOWN when no session has the ID. */
sxr_status sxr_reporter_id_valid(sxr_client* client, int64_t reporter_id, int64_t timeout_ms,
                                 int64_t* out_reporter_id, uint16_t* out_service_type);

/* getAllReporters: every session's reporter ID, in *out_ids (release with sxr_free; NULL when
 * there are none) and their number in *out_count. */
sxr_status sxr_get_all_reporters(sxr_client* client, int64_t timeout_ms, int64_t** out_ids,
                                 size_t* out_count);

/* killService: the service exits without replying, so this returns SXR_CONNECTION_LOST (the
 * service closed the connection) or SXR_TIMEOUT. */
sxr_status sxr_kill_service(sxr_client* client, int64_t timeout_ms);

/* status: the service's status dictionary as compact JSON text in *out_json (release with
 * sxr_free). Read-only: it changes nothing in the service. */
sxr_status sxr_get_status(sxr_client* client, int64_t timeout_ms, char** out_json);

#ifdef __cplusplus
} /* extern "C" */
#endif

#endif /* SXREPORTING_SXREPORTING_H_ */
