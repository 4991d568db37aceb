/* An adaptor for the back end "qdx": writes each event that is forwarded to it as one line of the daemon's
 * own log (standard error, which the service manager hands to the journal). A real one would hand the event
 * to a service on the device.
 *
 *   cc -shared -fPIC -o TQSPerformance.so qdx_adaptor.c
 *   D=/System/Library/PrivateFrameworks/Cadmor.framework/Frameworks/TQSPerformance.framework
 *   install -D -m 644 TQSPerformance.so $D/TQSPerformance.so
 */
#include <kytreporting/kytplugin.h>
#include <stdio.h>
#include <stdlib.h>

const uint32_t kyt_plugin_abi = KYT_PLUGIN_ABI;

struct adaptor {
  unsigned long events;
};

void* QDXAdaptor_new(void) {
  return calloc(1, sizeof(struct adaptor));
}

void QDXAdaptor_delete(void* self) {
  free(self);
}

const char* QDXAdaptor_description(void* self) {
  (void)self;
  return "<QDXAdaptor: example>";
}

/* One call, so that lines of several sessions do not mix. The JSON holds no line breaks and no control
 * characters. */
void QDXAdaptor_sendMessageWithMethod_respCode_dict_(void* self, uint16_t method, uint16_t resp_code,
                                                     const kyt_plugin_dictionary* dict) {
  struct adaptor* adaptor = self;
  fprintf(stderr, "<6>QDXAdaptor: event %lu, method %u, response %u: %s\n", ++adaptor->events,
          (unsigned)method, (unsigned)resp_code, dict->json);
}
