/* Plug-ins for kytreportingd: the adaptor to which the back end "qdx" forwards the events of some clients.
 *
 * A plug-in is a shared object in a bundle folder,
 *
 *   /System/Library/PrivateFrameworks/Cadmor.framework/Frameworks/TQSPerformance.framework/TQSPerformance.so
 *
 * owned by root (or by the daemon's user) and writable by nobody else. It exports, with C linkage,
 *
 *   kyt_plugin_abi         the version of these rules that it was built for, a uint32_t
 *   CLASS_new              the plain initialiser: a new object, or null
 *   CLASS_delete           optional: ends an object
 *   CLASS_description      optional: a text about an object for log lines; valid as long as the object
 *   CLASS_OPERATION        the operations; OPERATION is the operation's name with each colon made '_'
 *
 * so the operation "sendMessageWithMethod:respCode:dict:" of the class "QDXAdaptor" is the function
 * QDXAdaptor_sendMessageWithMethod_respCode_dict_, declared below. Include this header, define the functions,
 * and build with -shared -fPIC.
 *
 * Each session that forwards events makes an object of its own. The functions are called on the daemon's
 * worker threads: one object by one thread at a time, several objects at once. They may block, which holds up
 * the session's own client. They must not throw, change the process (signals, current folder, locale), or
 * fork. They run inside the daemon's confinement: files can be read where the daemon may read them, written
 * nowhere but among its own, and nothing can be executed. A shared object is loaded once and never unloaded.
 */
#ifndef KYTPLUGIN_H
#define KYTPLUGIN_H

#include <stddef.h>
#include <stdint.h>

#define KYT_PLUGIN_ABI 1

#if defined(__GNUC__)
#define KYT_PLUGIN_EXPORT __attribute__((visibility("default")))
#else
#define KYT_PLUGIN_EXPORT
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Write: const uint32_t kyt_plugin_abi = KYT_PLUGIN_ABI; */
extern KYT_PLUGIN_EXPORT const uint32_t kyt_plugin_abi;

/* A dictionary, as one JSON object in UTF-8, compact, keys in the order in which they were set. `json` ends
 * with a NUL that `length` does not count, and is valid during the call only. What JSON has no form for is
 * text: dates as "2026-01-31 12:00:00 +0000", data as "<0a1b2c>", numbers that are not finite as "nan", "inf"
 * and "-inf". */
typedef struct kyt_plugin_dictionary {
  const char* json;
  size_t length;
} kyt_plugin_dictionary;

KYT_PLUGIN_EXPORT void* QDXAdaptor_new(void);
KYT_PLUGIN_EXPORT void QDXAdaptor_delete(void* self);
KYT_PLUGIN_EXPORT const char* QDXAdaptor_description(void* self);
KYT_PLUGIN_EXPORT void QDXAdaptor_sendMessageWithMethod_respCode_dict_(void* self, uint16_t method,
                                                                       uint16_t resp_code,
                                                                       const kyt_plugin_dictionary* dict);

#ifdef __cplusplus
}
#endif

#endif /* KYTPLUGIN_H */
