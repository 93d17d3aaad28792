/*
 * Reports into the audio-telemetry service, from C and whatever can call C. Needs libvxreporting.
 *
 *   vxr_client *client = vxr_client_new(NULL);
 *   vxr_dict *message = vxr_dict_new();
 *   vxr_dict_set_double(message, "gain", 0.5);
 *   if (vxr_connect(client, NULL, VXR_DEFAULT_TIMEOUT) == VXR_OK) {
 *     vxr_create_session(client, 42, NULL, NULL);
 *     vxr_set_service_type(client, 42, 7, NULL, NULL);
 *     vxr_start_session(client, 42, NULL, NULL);
 *     vxr_send_message(client, message, 0x08000005, 1, NULL, NULL);
 *     vxr_stop_session(client, 42, NULL, NULL);
 *   }
 *   if (vxr_goodbye(client, VXR_DEFAULT_TIMEOUT) != VXR_OK) puts(vxr_error_text(client));
 *   vxr_dict_free(message);
 *   vxr_client_free(client);
 *
 * Blocking: only the functions with a timeout_ms wait, and no longer than that. All others return
 * at once, whatever the service does: what the socket does not take is buffered up to a bound, and
 * beyond it refused with VXR_BUFFER_FULL. They cost a system call once some 16 KiB are gathered;
 * vxr_process() and vxr_flush() write whatever there is. Call vxr_process() now and then, best when
 * vxr_fd() is readable: a client that leaves its answers unread for 10 seconds is cut off.
 *
 * Threads: the library has none. A client and its dictionaries may be used by one thread at a time;
 * different clients are independent. No thread may be cancelled inside the library.
 *
 * fork(): the connection stays with the parent. In the child only vxr_client_free() may be called,
 * which leaves the parent's connection alone; descriptors are closed by exec.
 *
 * Sessions that outlive the connection (keep_sessions): from vxr_connect() on, whether it succeeded
 * or not, until vxr_goodbye() or vxr_disconnect(), calls are taken without a connection too, up to
 * the bounds. vxr_process() and the functions that wait make the connection again, with pauses that
 * grow to five seconds; then the sessions are created, configured and started again, and what was
 * not begun to be written follows. A call that was written and not answered fails with
 * VXR_DISCONNECTED and is never sent again: it may have run. A start that holds goes on.
 *
 * Errors: a function that can fail returns VXR_OK or one of the codes below. vxr_error_text() says
 * what happened to a client, vxr_code_text() what a code means, for people. Wrong arguments (NULL,
 * too deep a dictionary) are VXR_INVALID_ARGUMENT, never a crash. No C++ exception leaves the
 * library; callbacks must not throw or longjmp() through it. Signals: SIGPIPE is never raised.
 */
#ifndef VXREPORTING_H
#define VXREPORTING_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#if defined(__GNUC__)
#define VXR_API __attribute__((visibility("default")))
#else
#define VXR_API
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* More may be added: take an unknown one as a failure. */
enum vxr_code {
  VXR_OK = 0,
  VXR_NOT_CONNECTED = 1,    /* vxr_connect() first */
  VXR_DISCONNECTED = 2,     /* the service went away, or sent something that is not the protocol */
  VXR_BUFFER_FULL = 3,      /* the service is not reading; nothing of the call was kept */
  VXR_TIMED_OUT = 4,        /* what was waited for has not come in time */
  VXR_REFUSED = 5,          /* the service answered with an error; see service_code */
  VXR_REPORTING_ERROR = 6,  /* the service refused a message; see domain and service_code */
  VXR_TOO_LARGE = 7,        /* the call does not fit into a frame, or never into the buffer */
  VXR_INVALID_ARGUMENT = 8, /* nothing was done */
  VXR_NO_MEMORY = 9,
  VXR_INTERNAL_ERROR = 10
};

/* What a code means; of any number. */
VXR_API const char* vxr_code_text(int code);
/* Of the library that is loaded. */
VXR_API const char* vxr_version(void);

/* --- dictionaries: messages and configurations --- */

typedef struct vxr_dict vxr_dict;

/* NULL when there is no memory. A dictionary may be used for any number of calls, and changed
   between them. */
VXR_API vxr_dict* vxr_dict_new(void);
VXR_API void vxr_dict_free(vxr_dict* dict); /* NULL is fine */

/* A key that is there already gets the new value. Texts are copied and should be UTF-8: what is not
   becomes U+FFFD. Kinds stay apart: true is not 1, and 1.0 is not 1. */
VXR_API int vxr_dict_set_int(vxr_dict* dict, const char* key, int64_t value);
VXR_API int vxr_dict_set_double(vxr_dict* dict, const char* key, double value);
VXR_API int vxr_dict_set_bool(vxr_dict* dict, const char* key, bool value);
VXR_API int vxr_dict_set_string(vxr_dict* dict, const char* key, const char* value);
/* Seconds since 1970. */
VXR_API int vxr_dict_set_date(vxr_dict* dict, const char* key, double seconds);
/* Copies it; nesting may be 32 levels deep. */
VXR_API int vxr_dict_set_dict(vxr_dict* dict, const char* key, const vxr_dict* value);
VXR_API int vxr_dict_set_ints(vxr_dict* dict, const char* key, const int64_t* values, size_t count);
VXR_API int vxr_dict_set_doubles(vxr_dict* dict, const char* key, const double* values,
                                 size_t count);
VXR_API int vxr_dict_set_strings(vxr_dict* dict, const char* key, const char* const* values,
                                 size_t count);

/* --- the connection --- */

typedef struct vxr_client vxr_client;

typedef struct vxr_options {
  size_t size;               /* of this structure, as VXR_OPTIONS_INIT sets it */
  size_t max_buffered_bytes; /* of calls not yet written; 0: 1 MiB */
  size_t max_pending_calls;  /* calls not yet answered, held starts included; 0: 65536 */
  bool keep_sessions;        /* see above */
} vxr_options;
#define VXR_OPTIONS_INIT \
  { sizeof(vxr_options), 0, 0, false }

/* Milliseconds; anything below 0 stands for the default of 5 seconds. */
#define VXR_DEFAULT_TIMEOUT (-1)

/* `options` may be NULL. NULL when there is no memory. */
VXR_API vxr_client* vxr_client_new(const vxr_options* options);
/* Ends the connection abruptly unless vxr_goodbye() came first. Pending callbacks are not called.
   May be called inside a callback. NULL is fine. */
VXR_API void vxr_client_free(vxr_client* client);

/* NULL or "" stands for $VXREPORTING_SOCKET, or /run/vxreporting/service.socket. */
VXR_API int vxr_connect(vxr_client* client, const char* socket_path, int timeout_ms);
VXR_API bool vxr_is_connected(const vxr_client* client);
/* An orderly end: everything sent before is run and answered, then the service closes. Waits for
   that. Otherwise returns what vxr_wait() would. */
VXR_API int vxr_goodbye(vxr_client* client, int timeout_ms);
/* Ends at once; every pending call fails. */
VXR_API void vxr_disconnect(vxr_client* client);

/* For a poll loop: wait for reading, and for writing when vxr_wants_write(), then vxr_process().
   -1 when there is no connection. */
VXR_API int vxr_fd(const vxr_client* client);
VXR_API bool vxr_wants_write(const vxr_client* client);
/* With keep_sessions: in so many milliseconds vxr_process() should be called whatever the
   descriptor says; -1: no need. */
VXR_API int vxr_retry_in_ms(const vxr_client* client);
/* Writes what is buffered, reads what is there, runs callbacks. */
VXR_API int vxr_process(vxr_client* client);
/* Writes what is buffered as far as the socket takes it. */
VXR_API int vxr_flush(vxr_client* client);
/* Waits until every call is answered, started sessions apart. The first failure since the last wait
   of a call that had no callback is returned here. */
VXR_API int vxr_wait(vxr_client* client, int timeout_ms);

/* Of a client that keeps its sessions: calls, but for the first and the last. */
typedef struct vxr_counters {
  uint64_t reconnections;
  uint64_t unanswered; /* written when the connection was lost: may have run, not sent again */
  uint64_t dropped;    /* refused with VXR_BUFFER_FULL, or given up before they were written */
  uint64_t sessions_not_restored; /* the service refused to have them again */
} vxr_counters;
/* `size` is that of the structure. */
VXR_API int vxr_get_counters(const vxr_client* client, vxr_counters* counters, size_t size);

/* What the last function of this client that failed would say to people. Valid until the next
   call. */
VXR_API const char* vxr_error_text(const vxr_client* client);

/* --- calls --- */

/* An answer, or why there is none. The library's own; valid while the callback runs. Fields may be
   added at the end. */
typedef struct vxr_result {
  int code;                   /* enum vxr_code */
  const char* text;           /* a sentence for people; "" with VXR_OK */
  const char* domain;         /* of a VXR_REPORTING_ERROR, else "" */
  int64_t service_code;       /* of a VXR_REFUSED (docs/protocol.md) or VXR_REPORTING_ERROR */
  int64_t value;              /* the service type; the identifier; 1 for true */
  uint16_t service_type;      /* vxr_validate_reporter() */
  const int64_t* identifiers; /* vxr_get_reporters() */
  size_t identifier_count;
} vxr_result;

/* Called once, inside vxr_process() and the functions that wait, and, when the connection is lost,
   inside whatever function finds out. May call back into the client, and free it. */
typedef void (*vxr_callback)(const vxr_result* result, void* user);

/* All return whether the call was taken; when it was not, the callback is not called. `done` may be
   NULL. Sessions are named by the caller's identifiers; the operations are those of
   docs/protocol.md. */
VXR_API int vxr_create_session(vxr_client* client, int64_t identifier, vxr_callback done,
                               void* user);
VXR_API int vxr_set_service_type(vxr_client* client, int64_t identifier, uint16_t service_type,
                                 vxr_callback done, void* user);
VXR_API int vxr_set_configuration(vxr_client* client, int64_t identifier,
                                  const vxr_dict* configuration, vxr_callback done, void* user);
/* Answered when the session is stopped. */
VXR_API int vxr_start_session(vxr_client* client, int64_t identifier, vxr_callback done,
                              void* user);
/* To every started session of the service. */
VXR_API int vxr_send_message(vxr_client* client, const vxr_dict* message, uint32_t category,
                             uint16_t type, vxr_callback done, void* user);
/* To these sessions; to none when count is 0. */
VXR_API int vxr_send_message_to(vxr_client* client, const vxr_dict* message, uint32_t category,
                                uint16_t type, const int64_t* identifiers, size_t count,
                                vxr_callback done, void* user);
VXR_API int vxr_stop_session(vxr_client* client, int64_t identifier, vxr_callback done, void* user);
VXR_API int vxr_destroy_session(vxr_client* client, int64_t identifier, vxr_callback done,
                                void* user);
VXR_API int vxr_get_service_type(vxr_client* client, int64_t identifier, vxr_callback done,
                                 void* user);
/* An unknown reporter gives 0 and the service type 65535. */
VXR_API int vxr_validate_reporter(vxr_client* client, int64_t identifier, vxr_callback done,
                                  void* user);
VXR_API int vxr_get_reporters(vxr_client* client, vxr_callback done, void* user);

/* --- from a thread that must never wait, as one that renders audio --- */

typedef struct vxr_realtime vxr_realtime;

enum vxr_kind { VXR_INTEGER = 0, VXR_DOUBLE = 1, VXR_BOOLEAN = 2 };
typedef struct vxr_key {
  const char* name;
  int kind; /* enum vxr_kind */
} vxr_key;
/* The member that the key's kind names; a boolean is an integer, 0 or 1. */
typedef union vxr_number {
  int64_t integer;
  double real;
} vxr_number;

/* A ring of at least `capacity` messages with these keys, category and type, between one thread
   that calls vxr_realtime_send() and one that calls vxr_realtime_process(). `identifiers`: the
   sessions that get them; NULL: all that are started. NULL when there is no memory or a kind is
   unknown. */
VXR_API vxr_realtime* vxr_realtime_new(const vxr_key* keys, size_t key_count, uint32_t category,
                                       uint16_t type, const int64_t* identifiers,
                                       size_t identifier_count, size_t capacity);
VXR_API void vxr_realtime_free(vxr_realtime* realtime); /* NULL is fine */
/* One number for each key, in their order. Neither allocates nor locks nor makes a system call.
   False, and counted, when the ring is full or there are not as many numbers as keys. */
VXR_API bool vxr_realtime_send(vxr_realtime* realtime, const vxr_number* numbers, size_t count);
/* On the thread of the client: gives it what was sent so far. What the client does not take now
   stays in the ring. Never blocks. */
VXR_API int vxr_realtime_process(vxr_realtime* realtime, vxr_client* client);
/* How many messages were not sent, for either reason. */
VXR_API uint64_t vxr_realtime_dropped(const vxr_realtime* realtime);

#ifdef __cplusplus
}
#endif

#endif
