#ifndef TARNEL_TARNEL_C_KEYS_H_
#define TARNEL_TARNEL_C_KEYS_H_

/* Keys of the dictionaries that a client and the daemon exchange, for C. The same texts as in keys.h. */

/* Session info. */
#define TARNEL_SESSION_INFO_SESSION_ID "sessionID"              /* unsigned integer, 32 bits */
#define TARNEL_SESSION_INFO_CLIENT_TYPE "clientType"            /* integer; 5 to 17 have a storebag */
#define TARNEL_SESSION_INFO_CLIENT_VERSION "clientVersion"      /* unsigned integer, 16 bits */
#define TARNEL_SESSION_INFO_REQUIRE_USER_INFO "requireUserInfo" /* boolean */
#define TARNEL_SESSION_INFO_BATCH_EVENT "batchEvent"            /* boolean */

/* User info. Other entries go into every event. */
#define TARNEL_USER_INFO_CLIENT_NAME "clientName"   /* text */
#define TARNEL_USER_INFO_SERVICE_NAME "serviceName" /* text */

/* A message as one dictionary. */
#define TARNEL_MESSAGE_PARAMETERS_CATEGORY "category" /* unsigned integer, 16 bits; mandatory */
#define TARNEL_MESSAGE_PARAMETERS_TYPE "type"         /* unsigned integer, 16 bits; mandatory */
#define TARNEL_MESSAGE_PARAMETERS_PAYLOAD "payload"   /* dictionary */
#define TARNEL_MESSAGE_PARAMETERS_FLAG "flag"         /* a tarnel_flag */

/* Names of the backends. */
#define TARNEL_BACKEND_HTTP_POST "httppost"
#define TARNEL_BACKEND_HTTP_POST2 "httppost2"
#define TARNEL_BACKEND_DASHBOARD "dashboard"
#define TARNEL_BACKEND_UPLOAD_SERVER "uploadserver"
#define TARNEL_BACKEND_DRAVIK "dravik"
#define TARNEL_BACKEND_VESMER "vesmer"

/* Domain of errors: code -1 for local failures, an HTTP status where a server switched a backend off. */
#define TARNEL_ERROR_DOMAIN "TarnelErrorDomain"

#endif
