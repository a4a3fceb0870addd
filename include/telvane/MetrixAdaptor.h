/* The wireless-diagnostics adaptor interface: how telvaned hands events to a
 * diagnostics sink that a device maker provides as a shared object.
 *
 * An adaptor is a shared object (built from C, C++ or anything that exports a C
 * symbol) that defines TELVANE_METRIX_ADAPTOR_SEND_MESSAGE_SYMBOL with the signature
 * of telvane_metrix_adaptor_send_message_fn. The daemon loads it once per process
 * with dlopen(RTLD_NOW | RTLD_LOCAL) from $TELVANED_METRIX_ADAPTOR, else from
 * "<libdir>/telvane/metrix-adaptor.so", looks the entry up with dlsym, and never
 * unloads it. The daemon's "metrix" backend (made only for client types 7, 11 and 13)
 * then calls the entry once for every event a session hands it. A missing object or
 * a missing entry is not fatal: the backend is still made, and each event becomes an
 * error line in the daemon's log instead.
 *
 * What one call carries:
 *   method        the event's category (16 bits)
 *   resp_code     the event's type (16 bits)
 *   dict_json     the event dictionary as one JSON object, UTF-8, compact form.
 *                 For session events it holds "ClientData" (the client's payload)
 *                 and, when the session has shared data, "SharedData". Bytes are
 *                 base64 strings, dates are seconds since 1970 (a number); values
 *                 JSON cannot carry (NaN, infinities, text that is not UTF-8) are
 *                 left out.
 *   dict_json_length  the number of bytes of the JSON text, not counting the NUL
 *                 that follows it (dict_json[dict_json_length] == '\0', so the text
 *                 may also be used as a C string).
 * The event's time stamp, event number and flag are not passed on.
 *
 * The dictionary travels as JSON text rather than as a tree of C structures: the
 * text is self-describing, needs no shared allocator or type definitions beyond this
 * header, stays stable when the daemon's own value type changes, and any language
 * can parse it.
 *
 * Ownership and lifetime: dict_json belongs to the daemon and is valid only for the
 * duration of the call. An adaptor that keeps the text copies it before returning,
 * and never frees or writes through the pointer.
 *
 * Threading: the entry may be called from several daemon threads at the same time
 * (each reporting session sends from its own queue), so it must be thread-safe. It
 * runs on the calling session's queue and holds up that session's events while it
 * runs: it must return quickly, doing any slow work (disk, network) elsewhere, and
 * must not wait for the daemon. It must not unload itself, must not let a C++
 * exception or a longjmp leave it, and must not change the process's signal
 * dispositions.
 */
#ifndef TELVANE_METRIX_ADAPTOR_H
#define TELVANE_METRIX_ADAPTOR_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The entry the daemon looks up; its name in the daemon's log lines is the
 * forwarding selector "sendMessageWithMethod:respCode:dict:". */
#define TELVANE_METRIX_ADAPTOR_SEND_MESSAGE_SYMBOL "telvane_metrix_adaptor_send_message"

/* The environment variable that names the adaptor object. */
#define TELVANE_METRIX_ADAPTOR_ENV "TELVANED_METRIX_ADAPTOR"

typedef void (*telvane_metrix_adaptor_send_message_fn)(uint16_t method, uint16_t resp_code, const char *dict_json,
                                                       size_t dict_json_length);

/* Defined by the adaptor (exported with default visibility), never by the daemon. */
void telvane_metrix_adaptor_send_message(uint16_t method, uint16_t resp_code, const char *dict_json,
                                         size_t dict_json_length);

#ifdef __cplusplus
}
#endif

#endif /* TELVANE_METRIX_ADAPTOR_H */
