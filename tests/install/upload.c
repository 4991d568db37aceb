/* Uploads a file in a session of its own, for check-kernel: upload CLIENT-NAME FILE. Its status is 0 when a back end took
 * the file, and the session's end was taken too. */
#include <kytreporting/kytreporting.h>
#include <stdio.h>

static void uploaded(int success, const char* error, void* context) {
  printf("uploaded: %d %s\n", success, error != NULL ? error : "");
  *(int*)context = success;
}

int main(int argc, char** argv) {
  if (argc != 3) return 2;
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_uint(info, "SessionID", 44);
  kyt_dictionary_set_int(info, "ClientType", 20);
  kyt_dictionary_set_bool(info, "RequireUserInfo", 1);
  kyt_dictionary* user = kyt_dictionary_new();
  kyt_dictionary_set_string(user, "ClientName", argv[1]);
  kyt_dictionary_set_string(user, "ServiceName", "demo");
  kyt_options options = {0};
  options.size = sizeof options;
  options.session_info = info;
  options.user_info = user;
  kyt_session* session = kyt_session_open(&options);
  kyt_dictionary_free(info);
  kyt_dictionary_free(user);
  int taken = 0;
  kyt_session_configure(session, NULL, NULL);
  kyt_session_upload_file(session, argv[2], uploaded, &taken);
  const int all = kyt_session_finish(session, 120000);
  kyt_session_close(session);
  return taken && all ? 0 : 1;
}
