#include "VantorSyncManager/PublicNames.h"

#define VSM_NAME(n) extern "C" VSM_EXPORT const char* const n = #n

VSM_NAME(NubiloLoginFailureException);
VSM_NAME(NubiloNetworkFailureException);
VSM_NAME(NubiloTransactionFailureException);
VSM_NAME(NubiloLockFailureException);
VSM_NAME(NubiloRelockFailureException);
VSM_NAME(NubiloResourceNotFoundException);
VSM_NAME(NubiloClientRegistrationException);
VSM_NAME(NubiloDataclassNotRegisteredException);
VSM_NAME(NubiloServerUnreachableException);
VSM_NAME(NubiloServerIncoherencyException);
VSM_NAME(NubiloFailedToDownloadChangelogException);
VSM_NAME(NubiloOptimisticLockingFailureException);
VSM_NAME(NubiloCorruptChangelogException);
VSM_NAME(NubiloTesselFullException);
VSM_NAME(NubiloInvalidChangeLogVersionException);
VSM_NAME(NubiloAccountExpiredException);
VSM_NAME(NubiloAccountMigratedException);
VSM_NAME(NubiloMinglerFailureException);

VSM_NAME(NubiloSyncPreparingNotification);
VSM_NAME(NubiloSyncStartedNotification);
VSM_NAME(NubiloSyncProgressNotification);
VSM_NAME(NubiloSyncProgressKey);
VSM_NAME(NubiloSyncEndedNotification);
VSM_NAME(NubiloSyncCancelledNotification);
VSM_NAME(NubiloSyncCancelledReasonKey);
VSM_NAME(NubiloSyncGlobalKey);
VSM_NAME(NubiloSyncTypeKey);
VSM_NAME(NubiloSyncTypeManual);
extern "C" VSM_EXPORT const char* const NubiloSyncCancelledByUser = "User Cancelled";
extern "C" VSM_EXPORT const char* const NubiloSyncCancelledByError = "Error Cancelled";
extern "C" VSM_EXPORT const char* const kLastSyncDateChangedNotification =
    "com.korvo.VantorSync.lastSyncDateChanged";

extern "C" VSM_EXPORT const char* const kVantorSyncClientId = "com.korvo.VantorSync";
extern "C" VSM_EXPORT const char* const kVantorDefaultsKey = "com.korvo.VantorSync";
extern "C" VSM_EXPORT const char* const kClientVersionKey = "VantorClientVersion";
extern "C" VSM_EXPORT const int32_t kAutoConfigVersion = -1;
extern "C" VSM_EXPORT const int32_t kCurrentConfigVersion = 251;
extern "C" VSM_EXPORT const int32_t kConfigTTLInHours = 24;
extern "C" VSM_EXPORT const int32_t kDefaultTTLInHours = 24;
// The service's hosts are reserved example names until a deployment sets its own.
extern "C" VSM_EXPORT const char* const kConfigHost = "configuration.nubilo.example";
extern "C" VSM_EXPORT const char* const kConfigURI = "configurations/internetservices/syncworks";
extern "C" VSM_EXPORT const char* const kConfigPList = "clientConfiguration";
extern "C" VSM_EXPORT const char* const SM_CLIENT_CLASS_BRAMBLE = "bramble";
extern "C" VSM_EXPORT const char* const _SMUserAgentBase = "VantorClient/%@/%@/%@";

extern "C" VSM_EXPORT const double VantorSyncManagerVersionNumber = 488.5;
extern "C" VSM_EXPORT const char VantorSyncManagerVersionString[] =
    "@(#)PROGRAM:VantorSyncManager  PROJECT:NubiloSyncClient-488.5\n";

extern "C" VSM_EXPORT const int32_t kNBSuccess = 1;
extern "C" VSM_EXPORT const int32_t kNBUnknownError = 100;
extern "C" VSM_EXPORT const int32_t kNBInvalidCredentials = 101;
extern "C" VSM_EXPORT const int32_t kNBInsufficientStorage = 102;
extern "C" VSM_EXPORT const int32_t kNBNetworkError = 103;
extern "C" VSM_EXPORT const int32_t kNBResourceNotFound = 104;
extern "C" VSM_EXPORT const int32_t kNBResourceExists = 105;
extern "C" VSM_EXPORT const int32_t kNBTimeoutError = 106;
extern "C" VSM_EXPORT const int32_t kNBInvalidParameter = 107;
extern "C" VSM_EXPORT const int32_t kNBServerError = 108;
extern "C" VSM_EXPORT const int32_t kNBInvalidProxyCredentials = 109;
extern "C" VSM_EXPORT const int32_t kNBInternalFailure = 110;
extern "C" VSM_EXPORT const int32_t kNBMultipartError = 150;
extern "C" VSM_EXPORT const int32_t kNBServiceBusy = 151;
extern "C" VSM_EXPORT const int32_t kNBTooManyRedirectsError = 152;
extern "C" VSM_EXPORT const int32_t kNBDAVResourceError = 153;

// A value no property of the sync namespace ever holds.
extern "C" VSM_EXPORT const char* const kNBRemoveProp = "<kNBRemoveProp>";
extern "C" VSM_EXPORT const char* const kNBURI = "kNBURI";
extern "C" VSM_EXPORT const char* const kNBLastModified = "DAV:getlastmodified";
extern "C" VSM_EXPORT const char* const kNBContentLength = "DAV:getcontentlength";
extern "C" VSM_EXPORT const int32_t kDAVZeroDepth = 0;
extern "C" VSM_EXPORT const int32_t kDAVOneDepth = 1;
