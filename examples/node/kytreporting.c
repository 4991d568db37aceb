/* Reporting from Node.js: an addon over the C interface, to be compiled as it is and loaded with require().
 *
 *   open(clientType, clientName, serviceName)   a session, configured; closed when nobody holds it any more
 *   send(session, category, type, payload)      whether the queue had room; throws the library's text otherwise
 *   finish(session, milliseconds)               sends what is queued, and waits: the event loop stands still meanwhile
 *
 * Payload values are texts, numbers and booleans; others are left out. No callback of the library's is used, so nothing of
 * it ever runs on a thread that Node.js does not know.
 */
#include <kytreporting/kytreporting.h>
#include <math.h>
#include <node_api.h>
#include <stdbool.h>
#include <stdlib.h>

#define MOST_ARGUMENTS 4
#define WHOLE_NUMBERS 9007199254740992.0 /* up to here a double holds each of them */

/* The text of a value, to be freed; null where it is none. */
static char* text_of(napi_env env, napi_value value) {
  size_t length = 0;
  if (napi_get_value_string_utf8(env, value, NULL, 0, &length) != napi_ok) return NULL;
  char* text = malloc(length + 1);
  if (text != NULL) napi_get_value_string_utf8(env, value, text, length + 1, &length);
  return text;
}

static void set_entry(napi_env env, kyt_dictionary* dictionary, const char* key, napi_value value) {
  napi_valuetype type = napi_undefined;
  napi_typeof(env, value, &type);
  if (type == napi_boolean) {
    bool given = false;
    napi_get_value_bool(env, value, &given);
    kyt_dictionary_set_bool(dictionary, key, given);
  } else if (type == napi_number) {
    double given = 0;
    napi_get_value_double(env, value, &given);
    if (given == floor(given) && fabs(given) <= WHOLE_NUMBERS)
      kyt_dictionary_set_int(dictionary, key, (int64_t)given);
    else
      kyt_dictionary_set_double(dictionary, key, given);
  } else if (type == napi_string) {
    char* text = text_of(env, value);
    kyt_dictionary_set_string(dictionary, key, text);
    free(text);
  }
}

static kyt_dictionary* dictionary_of(napi_env env, napi_value object) {
  kyt_dictionary* dictionary = kyt_dictionary_new();
  napi_value names;
  uint32_t count = 0;
  if (napi_get_property_names(env, object, &names) != napi_ok) return dictionary;
  napi_get_array_length(env, names, &count);
  for (uint32_t i = 0; i < count; ++i) {
    napi_value name, value;
    if (napi_get_element(env, names, i, &name) != napi_ok) continue;
    if (napi_get_property(env, object, name, &value) != napi_ok) continue;
    char* key = text_of(env, name);
    if (key != NULL) set_entry(env, dictionary, key, value);
    free(key);
  }
  return dictionary;
}

static void set_text(napi_env env, kyt_dictionary* dictionary, const char* key, napi_value value) {
  char* text = text_of(env, value);
  if (text != NULL) kyt_dictionary_set_string(dictionary, key, text);
  free(text);
}

static void close_session(napi_env env, void* session, void* hint) {
  (void)env;
  (void)hint;
  kyt_session_close(session);
}

static napi_value open_session(napi_env env, napi_callback_info call) {
  size_t count = MOST_ARGUMENTS;
  napi_value given[MOST_ARGUMENTS], result = NULL;
  napi_get_cb_info(env, call, &count, given, NULL, NULL);
  int32_t client_type = 0;
  napi_get_value_int32(env, given[0], &client_type);
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_int(info, "ClientType", client_type);
  kyt_dictionary_set_bool(info, "RequireUserInfo", 1);
  kyt_dictionary* user = kyt_dictionary_new();
  set_text(env, user, "ClientName", given[1]);
  set_text(env, user, "ServiceName", given[2]);
  char why[256];
  if (kyt_session_info_check(info, why, sizeof why)) {
    kyt_options options = {.size = sizeof options, .session_info = info, .user_info = user};
    kyt_session* session = kyt_session_open(&options);
    kyt_session_configure(session, NULL, NULL);
    napi_create_external(env, session, close_session, NULL, &result);
  } else {
    napi_throw_error(env, NULL, why);
  }
  kyt_dictionary_free(info);
  kyt_dictionary_free(user);
  return result;
}

/* The session of a call, its first argument; null, and an error is thrown, where it is none. */
static kyt_session* session_of(napi_env env, napi_callback_info call, napi_value* given) {
  size_t count = MOST_ARGUMENTS;
  void* session = NULL;
  napi_get_cb_info(env, call, &count, given, NULL, NULL);
  if (napi_get_value_external(env, given[0], &session) != napi_ok)
    napi_throw_type_error(env, NULL, "the first argument is no session");
  return session;
}

static napi_value send_message(napi_env env, napi_callback_info call) {
  napi_value given[MOST_ARGUMENTS], result = NULL;
  kyt_session* session = session_of(env, call, given);
  if (session == NULL) return NULL;
  uint32_t category = 0, type = 0;
  napi_get_value_uint32(env, given[1], &category);
  napi_get_value_uint32(env, given[2], &type);
  kyt_dictionary* payload = dictionary_of(env, given[3]);
  char why[256];
  kyt_error problem = kyt_session_try_send(session, category, type, payload, 0, why, sizeof why);
  kyt_dictionary_free(payload);
  if (problem != KYT_ERROR_NONE && problem != KYT_ERROR_QUEUE_FULL) {
    napi_throw_error(env, NULL, why);
    return NULL;
  }
  napi_get_boolean(env, problem == KYT_ERROR_NONE, &result);
  return result;
}

static napi_value finish_session(napi_env env, napi_callback_info call) {
  napi_value given[MOST_ARGUMENTS], result = NULL;
  kyt_session* session = session_of(env, call, given);
  if (session == NULL) return NULL;
  uint32_t milliseconds = 0;
  napi_get_value_uint32(env, given[1], &milliseconds);
  napi_get_boolean(env, kyt_session_finish(session, milliseconds), &result);
  return result;
}

static void export_function(napi_env env, napi_value exports, const char* name, napi_callback function) {
  napi_value value;
  napi_create_function(env, name, NAPI_AUTO_LENGTH, function, NULL, &value);
  napi_set_named_property(env, exports, name, value);
}

NAPI_MODULE_INIT() {
  export_function(env, exports, "open", open_session);
  export_function(env, exports, "send", send_message);
  export_function(env, exports, "finish", finish_session);
  return exports;
}
