#include "zerith/ZerithConstants.h"

extern "C" {

const char* const kZerithSessionInfoSessionID = "sessionID";
const char* const kZerithSessionInfoClientType = "clientType";
const char* const kZerithSessionInfoRequireUserInfo = "requireUserInfo";
const char* const kZerithSessionInfoHierarchyToken = "hierarchyToken";
const char* const kZerithSessionInfoClientVersion = "clientVersion";
const char* const kZerithSessionInfoBatchEvent = "batchEvent";

const char* const kZerithHierarchyTokenTokenID = "tokenID";
const char* const kZerithHierarchyTokenLevel = "level";

const char* const kZerithUserInfoClientName = "clientName";
const char* const kZerithUserInfoServiceName = "serviceName";

const char* const kZerithMessageParametersCategory = "category";
const char* const kZerithMessageParametersType = "type";
const char* const kZerithMessageParametersPayload = "payload";
const char* const kZerithMessageParametersFlag = "flag";

const char* const kZerithBackendHTTPPost = "httpsPost";
const char* const kZerithBackendHTTPPost2 = "httpsPost2";
const char* const kZerithBackendDashboard = "dashboard";
const char* const kZerithBackendQRS = "qrs";
const char* const kZerithBackendKovu = "kovu";
const char* const kZerithBackendPellamlog = "pellamlog";
const char* const kZerithBackendUploadServer = "uploadServer";

const char* const kZerithErrorDomain = "com.velmar.zerith.ErrorDomain";

}
