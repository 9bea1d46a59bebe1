// Classes of the older design that only still exist by name.
#include "VantorSyncManager/LegacySession.h"

SyncStatusManager::SyncStatusManager() = default;
SyncStatusManager::~SyncStatusManager() = default;

SMChangeLog::SMChangeLog() = default;
SMChangeLog::~SMChangeLog() = default;
