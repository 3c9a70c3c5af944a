#ifndef ZERITH_CONSTANTS_H
#define ZERITH_CONSTANTS_H

/* The vocabulary of the Zerith client framework: dictionary keys that
 * clients put into session info, user info and messages, the backend names
 * that storebags use, and the error domain. Exported by libzerith with C
 * linkage so that clients in any language (and the daemon) share one set of
 * strings. */

#if defined(__GNUC__)
#define ZERITH_EXPORT __attribute__((visibility("default")))
#else
#define ZERITH_EXPORT
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Session info */
ZERITH_EXPORT extern const char* const kZerithSessionInfoSessionID;       /* number */
ZERITH_EXPORT extern const char* const kZerithSessionInfoClientType;      /* number */
ZERITH_EXPORT extern const char* const kZerithSessionInfoRequireUserInfo; /* boolean */
ZERITH_EXPORT extern const char* const kZerithSessionInfoHierarchyToken;  /* dictionary */
ZERITH_EXPORT extern const char* const kZerithSessionInfoClientVersion;   /* number */
ZERITH_EXPORT extern const char* const kZerithSessionInfoBatchEvent;      /* boolean */

/* Hierarchy token */
ZERITH_EXPORT extern const char* const kZerithHierarchyTokenTokenID;      /* string */
ZERITH_EXPORT extern const char* const kZerithHierarchyTokenLevel;        /* number */

/* User info */
ZERITH_EXPORT extern const char* const kZerithUserInfoClientName;         /* string */
ZERITH_EXPORT extern const char* const kZerithUserInfoServiceName;        /* string */

/* Message parameters */
ZERITH_EXPORT extern const char* const kZerithMessageParametersCategory;  /* unsigned 16-bit */
ZERITH_EXPORT extern const char* const kZerithMessageParametersType;      /* unsigned 16-bit */
ZERITH_EXPORT extern const char* const kZerithMessageParametersPayload;   /* dictionary */
ZERITH_EXPORT extern const char* const kZerithMessageParametersFlag;      /* number */

/* Backend names, as storebag sections name them */
ZERITH_EXPORT extern const char* const kZerithBackendHTTPPost;
ZERITH_EXPORT extern const char* const kZerithBackendHTTPPost2;
ZERITH_EXPORT extern const char* const kZerithBackendDashboard;
ZERITH_EXPORT extern const char* const kZerithBackendQRS;
ZERITH_EXPORT extern const char* const kZerithBackendKovu;        /* "kovu" */
ZERITH_EXPORT extern const char* const kZerithBackendPellamlog;
ZERITH_EXPORT extern const char* const kZerithBackendUploadServer;

/* Errors */
ZERITH_EXPORT extern const char* const kZerithErrorDomain;

#ifdef __cplusplus
}
#endif

#endif /* ZERITH_CONSTANTS_H */
