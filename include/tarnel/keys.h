#pragma once

// Keys of the dictionaries that a client and the daemon exchange, names of the backends as the storebag
// lists them, and the domain of errors. The texts are part of the protocol: they never change.

namespace tarnel {

// Session info.
inline constexpr char kTarnelSessionInfoSessionID[] = "sessionID";              // unsigned integer, 32 bits
inline constexpr char kTarnelSessionInfoClientType[] = "clientType";            // integer; 5 to 17 are served
inline constexpr char kTarnelSessionInfoClientVersion[] = "clientVersion";      // unsigned integer, 16 bits
inline constexpr char kTarnelSessionInfoRequireUserInfo[] = "requireUserInfo";  // boolean
inline constexpr char kTarnelSessionInfoBatchEvent[] = "batchEvent";            // boolean

// User info; the two texts that correlate the sessions of one user activity. Other entries go into every
// event.
inline constexpr char kTarnelUserInfoClientName[] = "clientName";
inline constexpr char kTarnelUserInfoServiceName[] = "serviceName";

// A message as one dictionary.
inline constexpr char kTarnelMessageParametersCategory[] =
    "category";                                                       // unsigned integer, 16 bits; mandatory
inline constexpr char kTarnelMessageParametersType[] = "type";        // unsigned integer, 16 bits; mandatory
inline constexpr char kTarnelMessageParametersPayload[] = "payload";  // dictionary
inline constexpr char kTarnelMessageParametersFlag[] = "flag";  // 0 normal, 1 real-time, 2 important, 3 both

// Names of the backends.
inline constexpr char kTarnelBackendHTTPPost[] = "httppost";
inline constexpr char kTarnelBackendHTTPPost2[] = "httppost2";
inline constexpr char kTarnelBackendDashboard[] = "dashboard";
inline constexpr char kTarnelBackendUploadServer[] = "uploadserver";
inline constexpr char kTarnelBackendDravik[] = "dravik";
inline constexpr char kTarnelBackendVesmer[] = "vesmer";

// Domain of errors returned to clients: code -1 for local failures, an HTTP status where a server switched
// a backend off.
inline constexpr char kTarnelErrorDomain[] = "TarnelErrorDomain";

}  // namespace tarnel
