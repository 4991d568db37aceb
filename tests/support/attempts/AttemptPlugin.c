/* The plug-in in the intruder's place: an event whose payload says {"attempt": "NAME"} makes it try that
 * within the daemon, on the daemon's own thread, and write one line about it, "attempt NAME: ERRNO", 0 when it
 * was let. The environment variable KYT_ATTEMPTS_ROOT is the folder that stands for the root. */
#include <kytreporting/kytplugin.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "Attempts.h"

KYT_PLUGIN_EXPORT const uint32_t kyt_plugin_abi = KYT_PLUGIN_ABI;

static int object;

KYT_PLUGIN_EXPORT void* QDXAdaptor_new(void);
void* QDXAdaptor_new(void) {
  return &object;
}

KYT_PLUGIN_EXPORT void QDXAdaptor_sendMessageWithMethod_respCode_dict_(void* self, uint16_t method,
                                                                       uint16_t resp_code,
                                                                       const kyt_plugin_dictionary* dict);
void QDXAdaptor_sendMessageWithMethod_respCode_dict_(void* self, uint16_t method, uint16_t resp_code,
                                                     const kyt_plugin_dictionary* dict) {
  (void)self, (void)method, (void)resp_code;
  static const char kKey[] = "\"attempt\":\"";
  const char* const root = getenv("KYT_ATTEMPTS_ROOT");
  const char* name = strstr(dict->json, kKey);
  if (name == NULL || root == NULL) return;
  name += sizeof kKey - 1;
  const size_t length = strcspn(name, "\"");
  for (size_t i = 0; i < kAttemptCount; ++i) {
    if (strlen(kAttempts[i].name) != length || strncmp(kAttempts[i].name, name, length) != 0) continue;
    fprintf(stderr, "begins %s\n", kAttempts[i].name);
    const int error = kAttempts[i].run(root);
    fprintf(stderr, "attempt %s: %d\n", kAttempts[i].name, error);
  }
}
