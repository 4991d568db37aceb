/* Reporting from C: opens a session, configures it, sends a few events, and says goodbye. Prints where the session
 * stands; its status is 1 when nothing can arrive.
 *
 *   report_c [SOCKET]
 */
#include <kytreporting/kytreporting.h>
#include <stdio.h>

/* The last state that was told, which says more than the end's alone. */
static kyt_state last = KYT_STATE_NO_DAEMON;

static void changed(kyt_state state, const char* why, void* context) {
  (void)context;
  last = state;
  printf("%s: %s\n", kyt_state_name(state), why);
}

int main(int argc, char** argv) {
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_uint(info, "SessionID", 43);
  kyt_dictionary_set_int(info, "ClientType", 20);
  kyt_dictionary_set_int(info, "ClientVersion", 1);
  kyt_dictionary_set_bool(info, "BatchEvent", 1);
  kyt_dictionary_set_bool(info, "RequireUserInfo", 1);
  kyt_dictionary* user = kyt_dictionary_new();
  kyt_dictionary_set_string(user, "ClientName", "example");
  kyt_dictionary_set_string(user, "ServiceName", "demo");

  kyt_options options = {0};
  options.size = sizeof options;
  options.socket_path = argc > 1 ? argv[1] : NULL;
  options.session_info = info;
  options.user_info = user;
  options.on_state_change = changed;
  kyt_session* session = kyt_session_open(&options);
  kyt_dictionary_free(info);
  kyt_dictionary_free(user);

  /* The states are printed when they change; what is sent meanwhile waits its turn. */
  kyt_session_configure(session, NULL, NULL);
  kyt_dictionary* payload = kyt_dictionary_new();
  for (int i = 1; i <= 3; ++i) {
    kyt_dictionary_set_int(payload, "step", i);
    kyt_session_send(session, 10, 1, payload, 0);
  }
  kyt_dictionary_free(payload);

  int all = kyt_session_finish(session, 5000);
  kyt_statistics figures;
  kyt_session_statistics(session, &figures);
  printf("sent %llu, lost %llu\n", (unsigned long long)figures.sent,
         (unsigned long long)(figures.accepted - figures.sent));
  kyt_session_close(session); /* from here on no callback runs */
  return all && last == KYT_STATE_LIVE ? 0 : 1;
}
