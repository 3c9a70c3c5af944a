#ifndef ZERITH_C_API_H
#define ZERITH_C_API_H

/* The Zerith client framework for C and other languages.
 *
 * A zerith_session is one reporting session with the zerithd daemon over one
 * connection. Dictionaries and arrays go in and out as text, JSON or XML
 * property lists as chosen at creation; NULL stands for nil.
 *
 * Calls are asynchronous. An operation with a completion takes a callback
 * (NULL: no answer wanted); the callback runs once, on a thread of the
 * framework, with the completion's arguments as one dictionary text
 * ({"backends": [...]}, {"url": "..."}, {"result": "...", "error": {...}},
 * {"success": true}, ...) or, when the call failed (connection gone, call
 * refused), with reply NULL and the reason in `error`. The texts are valid
 * for the duration of the callback only.
 *
 * Functions returning int give 0 on success and -1 on failure;
 * zerith_last_error() then says why (per thread). Strings returned as
 * char* belong to the caller: free them with zerith_free(). */

#include <stddef.h>
#include <stdint.h>

#include "zerith/ZerithConstants.h"

#ifdef __cplusplus
extern "C" {
#endif

typedef struct zerith_session zerith_session;

typedef enum zerith_format {
  ZERITH_FORMAT_JSON = 0,
  ZERITH_FORMAT_PLIST_XML = 1,
  ZERITH_FORMAT_FORCE_INT = 0x7fffffff /* keeps the type int-sized; not a format */
} zerith_format;

typedef void (*zerith_reply_callback)(void* context, const char* reply, const char* error);
typedef void (*zerith_message_callback)(void* context, const char* message, double timestamp, uint16_t category,
                                        uint16_t type, const char* payload);
typedef void (*zerith_invalidation_callback)(void* context);

/* Lifecycle. zerith_connect(session, NULL) uses the default socket. */
ZERITH_EXPORT zerith_session* zerith_create(zerith_format format);
ZERITH_EXPORT int zerith_connect(zerith_session* session, const char* socket_path);
/* Ends the session and frees the handle; no callback runs afterwards. */
ZERITH_EXPORT void zerith_destroy(zerith_session* session);
ZERITH_EXPORT const char* zerith_last_error(void);
ZERITH_EXPORT void zerith_free(char* text);

ZERITH_EXPORT void zerith_set_message_callback(zerith_session* session, zerith_message_callback callback, void* context);
ZERITH_EXPORT void zerith_set_invalidation_callback(zerith_session* session, zerith_invalidation_callback callback,
                                                    void* context);

/* The client interface. */
ZERITH_EXPORT int zerith_set_session_info(zerith_session* session, const char* session_info, const char* user_info,
                                          const char* frameworks_to_check, int has_aggregation_block);
ZERITH_EXPORT int zerith_start_config(zerith_session* session, zerith_reply_callback callback, void* context);
ZERITH_EXPORT int zerith_fetch_states(zerith_session* session, const char* user_info, zerith_reply_callback callback,
                                      void* context);
ZERITH_EXPORT int zerith_fetch_display_url(zerith_session* session, zerith_reply_callback callback, void* context);
ZERITH_EXPORT int zerith_send_message(zerith_session* session, const char* message, zerith_reply_callback callback,
                                      void* context);
ZERITH_EXPORT int zerith_flush_messages(zerith_session* session, zerith_reply_callback callback, void* context);
ZERITH_EXPORT int zerith_finish_session(zerith_session* session);
ZERITH_EXPORT int zerith_upload_file(zerith_session* session, const char* file_url, const char* extension_token,
                                     zerith_reply_callback callback, void* context);
ZERITH_EXPORT int zerith_upload_log_data(zerith_session* session, const char* log_data, zerith_reply_callback callback,
                                         void* context);
ZERITH_EXPORT int zerith_send_message_with_session_info(zerith_session* session, const char* session_info,
                                                        const char* user_info, uint16_t category, uint16_t type,
                                                        const char* payload, zerith_reply_callback callback,
                                                        void* context);
ZERITH_EXPORT int zerith_update_shared_data(zerith_session* session, const char* dictionary);
/* `value` is any value as text; NULL removes the key. */
ZERITH_EXPORT int zerith_update_shared_data_for_key(zerith_session* session, const char* key, const char* value);
ZERITH_EXPORT int zerith_set_digest_key(zerith_session* session, const void* key, size_t length, int32_t algorithm);

/* The framework. */
ZERITH_EXPORT char* zerith_framework_version(void);
ZERITH_EXPORT char* zerith_public_key_path(void);
ZERITH_EXPORT char* zerith_persistent_identifier_for_dnu(int dnu);

#ifdef __cplusplus
}
#endif

#endif /* ZERITH_C_API_H */
