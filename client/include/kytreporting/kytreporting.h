/* libkytreporting: reporting events to kytreportingd from C, and from every language that can call C.
 *
 * The same library as <kytreporting/KYTReporting.h>, with the same promises: nothing blocks the caller on the
 * daemon or the network; what does not fit into the bounded queue is dropped and counted; a daemon that dies
 * and returns is connected again. Callbacks run on the library's thread, one at a time, each exactly once;
 * they must not block. A call that fails at once (the session is closed or its information wrong, no room, a number
 * out of range) calls back before it returns, on the caller's thread.
 *
 * Strings are UTF-8 and NUL-terminated and are copied. Objects made by kyt_..._new are owned by the caller
 * until they are freed or taken by a function that says so. Functions that answer int answer 1 for yes and 0
 * for no. A null session, dictionary or key is an error of the caller that is answered with 0 or nothing: without a
 * session there is no callback either. Every other call that takes a callback runs it, whatever else is null.
 * KYTREPORTING_DEBUG=1 in the environment makes every change of a session's state, and every drop, a line on standard
 * error.
 */
#ifndef KYTREPORTING_H
#define KYTREPORTING_H

#include <stddef.h>
#include <stdint.h>

#if defined(__GNUC__)
#define KYT_API __attribute__((visibility("default")))
#else
#define KYT_API
#endif

#ifdef __cplusplus
extern "C" {
#endif

typedef struct kyt_dictionary kyt_dictionary;
typedef struct kyt_session kyt_session;

/* Dictionaries: keys in the order in which they were first set; setting a key again replaces its value. */
KYT_API kyt_dictionary* kyt_dictionary_new(void);
KYT_API void kyt_dictionary_free(kyt_dictionary* dictionary);
KYT_API void kyt_dictionary_set_string(kyt_dictionary* dictionary, const char* key, const char* value);
KYT_API void kyt_dictionary_set_int(kyt_dictionary* dictionary, const char* key, int64_t value);
KYT_API void kyt_dictionary_set_uint(kyt_dictionary* dictionary, const char* key, uint64_t value);
KYT_API void kyt_dictionary_set_double(kyt_dictionary* dictionary, const char* key, double value);
KYT_API void kyt_dictionary_set_bool(kyt_dictionary* dictionary, const char* key, int value);
/* Seconds since 1970. */
KYT_API void kyt_dictionary_set_date(kyt_dictionary* dictionary, const char* key, double seconds);
KYT_API void kyt_dictionary_set_data(kyt_dictionary* dictionary, const char* key, const void* bytes,
                                     size_t length);
/* The value stays the caller's; later changes of it do not reach `dictionary`. */
KYT_API void kyt_dictionary_set_dictionary(kyt_dictionary* dictionary, const char* key,
                                           const kyt_dictionary* value);
typedef struct kyt_array kyt_array;
/* The value stays the caller's; later changes of it do not reach `dictionary`. */
KYT_API void kyt_dictionary_set_array(kyt_dictionary* dictionary, const char* key, const kyt_array* value);
KYT_API void kyt_dictionary_remove(kyt_dictionary* dictionary, const char* key);
KYT_API size_t kyt_dictionary_count(const kyt_dictionary* dictionary);
/* The text of a string value, or null; valid until the dictionary changes. */
KYT_API const char* kyt_dictionary_get_string(const kyt_dictionary* dictionary, const char* key);
/* The reading of a number or string value, or `otherwise` when there is none. */
KYT_API int64_t kyt_dictionary_get_int(const kyt_dictionary* dictionary, const char* key, int64_t otherwise);
KYT_API double kyt_dictionary_get_double(const kyt_dictionary* dictionary, const char* key, double otherwise);

/* Arrays: what uploaded log data is made of. */
KYT_API kyt_array* kyt_array_new(void);
KYT_API void kyt_array_free(kyt_array* array);
KYT_API void kyt_array_append_string(kyt_array* array, const char* value);
KYT_API void kyt_array_append_int(kyt_array* array, int64_t value);
KYT_API void kyt_array_append_uint(kyt_array* array, uint64_t value);
KYT_API void kyt_array_append_double(kyt_array* array, double value);
KYT_API void kyt_array_append_bool(kyt_array* array, int value);
/* Seconds since 1970. */
KYT_API void kyt_array_append_date(kyt_array* array, double seconds);
KYT_API void kyt_array_append_data(kyt_array* array, const void* bytes, size_t length);
/* The value stays the caller's; later changes of it do not reach `array`. */
KYT_API void kyt_array_append_dictionary(kyt_array* array, const kyt_dictionary* value);
KYT_API void kyt_array_append_array(kyt_array* array, const kyt_array* value);
KYT_API size_t kyt_array_count(const kyt_array* array);

/* Reading what a callback was given, entry by entry, whatever its keys are. A value belongs to its dictionary and is valid
 * until that changes or, in a callback, until the callback returns. */
typedef struct kyt_value kyt_value;
typedef enum kyt_kind {
  KYT_KIND_NULL = 0,
  KYT_KIND_BOOL = 1,
  KYT_KIND_INT = 2,
  KYT_KIND_UINT = 3,
  KYT_KIND_DOUBLE = 4,
  KYT_KIND_DATE = 5,
  KYT_KIND_STRING = 6,
  KYT_KIND_DATA = 7,
  KYT_KIND_ARRAY = 8,
  KYT_KIND_DICTIONARY = 9
} kyt_kind;
/* The entry of that place in the dictionary's order, the first being 0, and its key, where `key` is not null; null, and a
 * null key, from kyt_dictionary_count on. */
KYT_API const kyt_value* kyt_dictionary_at(const kyt_dictionary* dictionary, size_t index, const char** key);
/* KYT_KIND_NULL for null. */
KYT_API kyt_kind kyt_value_kind(const kyt_value* value);
/* The reading of a boolean, number or text; 0 for others. */
KYT_API int64_t kyt_value_int(const kyt_value* value);
KYT_API uint64_t kyt_value_uint(const kyt_value* value);
/* Of a date, the seconds since 1970. */
KYT_API double kyt_value_double(const kyt_value* value);
/* A text, NUL-terminated, or data, and how many bytes it has, where `length` is not null; null and 0 for others. */
KYT_API const char* kyt_value_bytes(const kyt_value* value, size_t* length);
/* Of an array or a dictionary; 0 for others. */
KYT_API size_t kyt_value_count(const kyt_value* value);
/* As kyt_dictionary_at; the key is null in an array. */
KYT_API const kyt_value* kyt_value_at(const kyt_value* value, size_t index, const char** key);

/* What is wrong, as a number. */
typedef enum kyt_error {
  KYT_ERROR_NONE = 0,
  KYT_ERROR_NOT_CONNECTED = 1, /* the connection ended before the answer, or there is no daemon */
  KYT_ERROR_CLOSED = 2,        /* the session was closed, or belongs to the parent of this process */
  KYT_ERROR_QUEUE_FULL = 3,    /* the bounded queue had no room */
  KYT_ERROR_REFUSED = 4,       /* the daemon answered with an error */
  KYT_ERROR_INVALID = 5,       /* the arguments cannot be meant or sent so */
  KYT_ERROR_TIMED_OUT = 6,     /* no daemon took the call within the call deadline */
  KYT_ERROR_BACK_END = 7       /* what was asked for was tried, and failed: the text says what */
} kyt_error;
/* Of the error that a callback was given, while it runs, on its thread; KYT_ERROR_NONE otherwise. */
KYT_API kyt_error kyt_callback_error(void);

/* `error` is null when all went well; otherwise its text. Arguments are valid during the call only. */
typedef void (*kyt_states_callback)(const char* const* names, size_t count, int has_storebag,
                                    const char* error, void* context);
typedef void (*kyt_success_callback)(int success, const char* error, void* context);
typedef void (*kyt_text_callback)(const char* text, const char* error, void* context);
/* The last message of an aggregation has no session information, no payload, and zeros. */
typedef void (*kyt_aggregation_callback)(const kyt_dictionary* session_info, double timestamp,
                                         uint16_t category, uint16_t type, const kyt_dictionary* payload,
                                         void* context);

/* How far a session's messages get, as far as the library can know. */
typedef enum kyt_state {
  KYT_STATE_NO_DAEMON = 0,        /* no connection: no socket, nobody listens, or the connection ended */
  KYT_STATE_REFUSED = 1,          /* the daemon does not serve this program, or the information is wrong */
  KYT_STATE_CONNECTED = 2,        /* connected, and not configured yet: the daemon drops what is sent */
  KYT_STATE_NO_STOREBAG = 3,      /* configured; no storebag, or one without back ends: all is dropped */
  KYT_STATE_NO_LIVE_BACK_END = 4, /* configured, and no back end takes events */
  KYT_STATE_LIVE = 5              /* at least one back end takes events */
} kyt_state;
/* "no-daemon", "refused", "connected", "no-storebag", "no-live-back-end", "live"; never freed. Null for a number that is
 * no state. */
KYT_API const char* kyt_state_name(kyt_state state);
/* `why` is a text for people. */
typedef void (*kyt_state_callback)(kyt_state state, const char* why, void* context);

typedef struct kyt_options {
  size_t size;                          /* sizeof(kyt_options): how the library knows which fields exist */
  const char* socket_path;              /* null: as usual */
  const kyt_dictionary* session_info;   /* "SessionID", "ClientType", "ClientVersion", "BatchEvent", ... */
  const kyt_dictionary* user_info;      /* "ClientName", "ServiceName", ...; null: none */
  kyt_aggregation_callback aggregation; /* null: the session does not aggregate */
  void* aggregation_context;
  size_t max_queued_messages;         /* 0: the default, 4096 */
  size_t max_queued_bytes;            /* 0: the default, 4 MiB */
  kyt_state_callback on_state_change; /* null: nobody is told */
  void* state_context;
  /* How long a callback waits for a daemon that is not there. 0: the default, 30000; negative: as long as the session
   * lives. */
  int64_t call_deadline_milliseconds;
  int finish_waits_for_daemon; /* 0: kyt_session_finish gives up when no daemon ever took anything and none is there */
  /* Flushes every so often if anything was sent since the last flush. 0: never. */
  int64_t flush_interval_milliseconds;
  /* kyt_session_close first does what kyt_session_finish does, for so long at most. 0: it does not. */
  int64_t finish_on_close_milliseconds;
  /* Not 0: a session that finds nobody when it first tries to connect has ended; it takes nothing, and what was queued is
   * lost and counted. */
  int ends_without_daemon;
} kyt_options;

/* Whether a session's information can be meant so: 0 when it has a key that there is not, or a value of another
 * type or out of range. Then `error`, of `size` bytes (none: null and 0), gets a text that names the key, cut to fit
 * and NUL-terminated; otherwise "". A session opened with such information sends nothing, and its callbacks get
 * this error. */
KYT_API int kyt_session_info_check(const kyt_dictionary* session_info, char* error, size_t size);

/* Null only for missing options. */
KYT_API kyt_session* kyt_session_open(const kyt_options* options);
/* What was queued and not sent is lost; finish first to keep it. No callback runs after it has returned. */
KYT_API void kyt_session_close(kyt_session* session);
/* The same without freeing it: it is still to be closed, and takes nothing any more. Any number of threads, beside calls
 * of others to the session. */
KYT_API void kyt_session_end(kyt_session* session);
/* Ends all sessions and single messages of this process as kyt_session_close does, but frees no session: each is still to
 * be closed. No callback runs on the library's thread once it has returned, unless a session is opened later: for
 * languages that cannot be called any more when their program ends. */
KYT_API void kyt_close_all(void);
/* Sends what is queued, says goodbye, waits at most so many milliseconds; whether all was sent. Gives up at once when no
 * daemon ever took anything and none is there. */
KYT_API int kyt_session_finish(kyt_session* session, unsigned timeout_milliseconds);

/* Where the session stands; KYT_STATE_NO_DAEMON for null. */
KYT_API kyt_state kyt_session_state(const kyt_session* session);
/* Why, as a text of at most `size` - 1 bytes, cut to fit and NUL-terminated. */
KYT_API void kyt_session_state_reason(const kyt_session* session, char* reason, size_t size);

KYT_API void kyt_session_configure(kyt_session* session, kyt_states_callback callback, void* context);
/* New user information; null: as it was where RequireUserInfo is set, else none from now on. */
KYT_API void kyt_session_fetch_states(kyt_session* session, const kyt_dictionary* user_info,
                                      kyt_states_callback callback, void* context);
/* Whether the message was taken. Category and type are 0 to 65535; other numbers are refused. `payload` may be null and
 * stays the caller's. Flags: 1 realtime, 2 expedite, 3 both. */
KYT_API int kyt_session_send(kyt_session* session, uint32_t category, uint32_t type,
                             const kyt_dictionary* payload, uint32_t flag);
/* The same, and says why a message was not taken: KYT_ERROR_NONE when it was; otherwise `error`, of `size` bytes (none:
 * null and 0), gets a text, cut to fit and NUL-terminated. */
KYT_API kyt_error kyt_session_try_send(kyt_session* session, uint32_t category, uint32_t type,
                                       const kyt_dictionary* payload, uint32_t flag, char* error,
                                       size_t size);
/* The same with the daemon's answer: the text of what was posted, or null. */
KYT_API void kyt_session_send_with_reply(kyt_session* session, uint32_t category, uint32_t type,
                                         const kyt_dictionary* payload, uint32_t flag,
                                         kyt_text_callback callback, void* context);
KYT_API void kyt_session_fetch_display_url(kyt_session* session, kyt_text_callback callback, void* context);
/* The callback gets the text of what was posted (or null), or the first error. */
KYT_API void kyt_session_flush(kyt_session* session, kyt_text_callback callback, void* context);
KYT_API void kyt_session_update_shared_data(kyt_session* session, const kyt_dictionary* entries);
KYT_API void kyt_session_remove_shared_data(kyt_session* session, const char* key);
/* Algorithm 0 is HMAC-SHA1. */
KYT_API void kyt_session_set_digest_key(kyt_session* session, const void* bytes, size_t length,
                                        int32_t algorithm);

/* Whether a back end took it. The file is opened at once, with the caller's rights; a file that cannot be opened is
 * answered before the call returns, and so is a null path or array. The array stays the caller's. */
KYT_API void kyt_session_upload_file(kyt_session* session, const char* path, kyt_success_callback callback,
                                     void* context);
KYT_API void kyt_session_upload_log_data(kyt_session* session, const kyt_array* log_data,
                                         kyt_success_callback callback, void* context);

/* Where a session's messages are, and what else happened to it. Always, unless something is in motion:
 *   accepted = sent + queued + lost_on_connection_end + lost_in_queue + dropped_unsendable + dropped_too_late
 * and what was refused (dropped_queue_full, dropped_closed, dropped_invalid) was not accepted. A later library may have
 * more figures, at the end. */
typedef struct kyt_statistics {
  uint64_t sent;               /* written to the daemon's socket, and not lost with their connection */
  uint64_t dropped_queue_full; /* refused: the queue was full */
  uint64_t
      lost_on_connection_end; /* written; their connection ended before the daemon is known to have taken them */
  uint64_t dropped_closed;    /* refused: after the end, or in a child process */
  uint64_t
      dropped_invalid; /* refused: numbers out of range, wrong session information; and other calls that could
                                    * not be encoded */
  uint64_t connections; /* connections made, the first included */
  uint64_t queued;      /* in the queue now */
  uint64_t
      waited_too_long;    /* calls, messages or not, whose callback waited for a daemon until the deadline */
  uint64_t replay_failed; /* values that a daemon that came back could not be told again */
  uint64_t sent_unconfigured;  /* sent before the configuration: the daemon dropped them */
  uint64_t accepted;           /* messages that were not refused */
  uint64_t lost_in_queue;      /* still in the queue when the session ended */
  uint64_t dropped_unsendable; /* larger than a megabyte, or nested too deeply */
  uint64_t dropped_too_late;   /* no daemon took them within the call deadline */
} kyt_statistics;
/* `size` is sizeof(kyt_statistics): how the library knows which figures exist. It writes those, 0 for figures that it does
 * not have, and nothing behind them. A null session has zeros. */
KYT_API void kyt_session_read_statistics(const kyt_session* session, kyt_statistics* statistics, size_t size);
/* The same: the sums over all sessions of this process, ended ones and single messages included. In a child made by fork()
 * they begin at zero, and the parent's sessions do not count. */
KYT_API void kyt_total_read_statistics(kyt_statistics* statistics, size_t size);
/* The first fourteen figures, those above, in every library of this name: whoever wants later ones calls the functions that
 * take a size. For a null session nothing is written. */
KYT_API void kyt_session_statistics(const kyt_session* session, kyt_statistics* statistics);
KYT_API void kyt_total_statistics(kyt_statistics* statistics);

/* One event without a session of its own; the callback gets "finished", or what went wrong: null options too. */
KYT_API void kyt_send_single_message(const kyt_options* options, uint32_t category, uint32_t type,
                                     const kyt_dictionary* payload, kyt_text_callback callback,
                                     void* context);

/* A program's last word: one event, encoded when the program is well, and sent by a handler of SIGSEGV, SIGABRT and the
 * like. Of the options the socket, session information and user information count. Null for missing options, wrong session
 * information, numbers out of range, a socket's path that is too long, and more than a megabyte. The session information must
 * have a client type and a session ID, else the daemon takes nothing. Made once, it can be sent any number of times, by one
 * thread at a time, and as the user that made it: who gives up privileges makes it afterwards. */
typedef struct kyt_last_word kyt_last_word;
KYT_API kyt_last_word* kyt_last_word_new(const kyt_options* options, uint32_t category, uint32_t type,
                                         const kyt_dictionary* payload);
KYT_API void kyt_last_word_free(kyt_last_word* word);
/* Async-signal-safe: on a connection of its own, with no memory taken, no lock and no part of the library but this. Whether
 * the daemon answered that it has taken the event, within so many milliseconds: not where the client type has no storebag,
 * or the session information lacks what a session needs. Leaves errno as it was. */
KYT_API int kyt_last_word_send(const kyt_last_word* word, unsigned timeout_milliseconds);

#ifdef __cplusplus
}
#endif

#endif /* KYTREPORTING_H */
