cat > hello.c <<'END'
#include <kytreporting/kytreporting.h>

int main(void) {
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_int(info, "ClientType", 20);
  kyt_dictionary_set_bool(info, "RequireUserInfo", 1);
  kyt_dictionary* user = kyt_dictionary_new();
  kyt_dictionary_set_string(user, "ClientName", "hello");
  kyt_dictionary_set_string(user, "ServiceName", "demo");
  kyt_options options = {.size = sizeof options, .session_info = info, .user_info = user};
  kyt_session* session = kyt_session_open(&options);
  kyt_dictionary_free(info);
  kyt_dictionary_free(user);
  kyt_session_configure(session, NULL, NULL);
  kyt_dictionary* payload = kyt_dictionary_new();
  kyt_dictionary_set_int(payload, "step", 1);
  kyt_session_send(session, 10, 1, payload, 0);
  kyt_dictionary_free(payload);
  int all = kyt_session_finish(session, 5000);
  kyt_session_close(session);
  return all ? 0 : 1;
}
END
cc hello.c $(pkg-config --cflags --libs kytreporting) -o hello
kytdemo --stage -- ./hello
