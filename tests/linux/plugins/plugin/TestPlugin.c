/* A plug-in that keeps what it was told for the test to look at. With KYT_TEST_ABI it claims other rules. */
#include <kytreporting/kytplugin.h>
#include <stdio.h>
#include <string.h>

#ifdef KYT_TEST_ABI
const uint32_t kyt_plugin_abi = KYT_TEST_ABI;
#else
const uint32_t kyt_plugin_abi = KYT_PLUGIN_ABI;
#endif

struct record {
  int objects;
  unsigned method, respCode;
  size_t length;
  char json[512];
};
KYT_PLUGIN_EXPORT struct record test_record;

static int object;

void* QDXAdaptor_new(void) {
  ++test_record.objects;
  return &object;
}

void QDXAdaptor_delete(void* self) {
  if (self == &object) --test_record.objects;
}

const char* QDXAdaptor_description(void* self) {
  return self == &object ? "the test's adaptor" : "another";
}

void QDXAdaptor_sendMessageWithMethod_respCode_dict_(void* self, uint16_t method, uint16_t resp_code,
                                                     const kyt_plugin_dictionary* dict) {
  if (self != &object) return;
  test_record.method = method;
  test_record.respCode = resp_code;
  test_record.length = dict->length;
  snprintf(test_record.json, sizeof test_record.json, "%s", dict->json);
}

/* Classes with less. */
KYT_PLUGIN_EXPORT void* Plain_new(void);
void* Plain_new(void) {
  return &object;
}
KYT_PLUGIN_EXPORT void* Failing_new(void);
void* Failing_new(void) {
  return 0;
}
