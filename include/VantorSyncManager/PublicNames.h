// The fixed vocabulary that callers compile against: failure names,
// notification names and keys, identifiers, configuration constants, the
// library's version and the transaction result codes. All of them are
// exported C data symbols, so `nm -D` shows them unmangled.
#pragma once

#include <cstdint>

#include "VantorSyncManager/Export.h"

extern "C" {

// Failure names (each value equals its own name).
VSM_EXPORT extern const char* const NubiloLoginFailureException;
VSM_EXPORT extern const char* const NubiloNetworkFailureException;
VSM_EXPORT extern const char* const NubiloTransactionFailureException;
VSM_EXPORT extern const char* const NubiloLockFailureException;
VSM_EXPORT extern const char* const NubiloRelockFailureException;
VSM_EXPORT extern const char* const NubiloResourceNotFoundException;
VSM_EXPORT extern const char* const NubiloClientRegistrationException;
VSM_EXPORT extern const char* const NubiloDataclassNotRegisteredException;
VSM_EXPORT extern const char* const NubiloServerUnreachableException;
VSM_EXPORT extern const char* const NubiloServerIncoherencyException;
VSM_EXPORT extern const char* const NubiloFailedToDownloadChangelogException;
VSM_EXPORT extern const char* const NubiloOptimisticLockingFailureException;
VSM_EXPORT extern const char* const NubiloCorruptChangelogException;
VSM_EXPORT extern const char* const NubiloTesselFullException;
VSM_EXPORT extern const char* const NubiloInvalidChangeLogVersionException;
VSM_EXPORT extern const char* const NubiloAccountExpiredException;
VSM_EXPORT extern const char* const NubiloAccountMigratedException;
VSM_EXPORT extern const char* const NubiloMinglerFailureException;

// Sync notifications and their keys.
VSM_EXPORT extern const char* const NubiloSyncPreparingNotification;
VSM_EXPORT extern const char* const NubiloSyncStartedNotification;
VSM_EXPORT extern const char* const NubiloSyncProgressNotification;
VSM_EXPORT extern const char* const NubiloSyncProgressKey;
VSM_EXPORT extern const char* const NubiloSyncEndedNotification;
VSM_EXPORT extern const char* const NubiloSyncCancelledNotification;
VSM_EXPORT extern const char* const NubiloSyncCancelledReasonKey;
VSM_EXPORT extern const char* const NubiloSyncCancelledByUser;
VSM_EXPORT extern const char* const NubiloSyncCancelledByError;
VSM_EXPORT extern const char* const NubiloSyncGlobalKey;
VSM_EXPORT extern const char* const NubiloSyncTypeKey;
VSM_EXPORT extern const char* const NubiloSyncTypeManual;
VSM_EXPORT extern const char* const kLastSyncDateChangedNotification;

// Identifiers and configuration constants.
VSM_EXPORT extern const char* const kVantorSyncClientId;
VSM_EXPORT extern const char* const kVantorDefaultsKey;
VSM_EXPORT extern const char* const kClientVersionKey;
VSM_EXPORT extern const int32_t kAutoConfigVersion;
VSM_EXPORT extern const int32_t kCurrentConfigVersion;
VSM_EXPORT extern const int32_t kConfigTTLInHours;
VSM_EXPORT extern const int32_t kDefaultTTLInHours;
VSM_EXPORT extern const char* const kConfigHost;
VSM_EXPORT extern const char* const kConfigURI;
VSM_EXPORT extern const char* const kConfigPList;
VSM_EXPORT extern const char* const SM_CLIENT_CLASS_BRAMBLE;
VSM_EXPORT extern const char* const _SMUserAgentBase;

// Version.
VSM_EXPORT extern const double VantorSyncManagerVersionNumber;
VSM_EXPORT extern const char VantorSyncManagerVersionString[];

// Transaction result codes.
VSM_EXPORT extern const int32_t kNBSuccess;
VSM_EXPORT extern const int32_t kNBUnknownError;
VSM_EXPORT extern const int32_t kNBInvalidCredentials;
VSM_EXPORT extern const int32_t kNBInsufficientStorage;
VSM_EXPORT extern const int32_t kNBNetworkError;
VSM_EXPORT extern const int32_t kNBResourceNotFound;
VSM_EXPORT extern const int32_t kNBResourceExists;
VSM_EXPORT extern const int32_t kNBTimeoutError;
VSM_EXPORT extern const int32_t kNBInvalidParameter;
VSM_EXPORT extern const int32_t kNBServerError;
VSM_EXPORT extern const int32_t kNBInvalidProxyCredentials;
VSM_EXPORT extern const int32_t kNBInternalFailure;
VSM_EXPORT extern const int32_t kNBMultipartError;
VSM_EXPORT extern const int32_t kNBServiceBusy;
VSM_EXPORT extern const int32_t kNBTooManyRedirectsError;
VSM_EXPORT extern const int32_t kNBDAVResourceError;

// Markers of the WebDAV layer: a property value that removes the property in
// a PROPPATCH, listing and attribute keys, and the PROPFIND depths.
VSM_EXPORT extern const char* const kNBRemoveProp;
VSM_EXPORT extern const char* const kNBURI;
VSM_EXPORT extern const char* const kNBLastModified;
VSM_EXPORT extern const char* const kNBContentLength;
VSM_EXPORT extern const int32_t kDAVZeroDepth;
VSM_EXPORT extern const int32_t kDAVOneDepth;

}  // extern "C"
