// Umbrella header of the library.
#pragma once

#include "VantorSyncManager/AssertionHandler.h"
#include "VantorSyncManager/DavTransaction.h"
#include "VantorSyncManager/Diagnostics.h"
#include "VantorSyncManager/Log.h"
#include "VantorSyncManager/MemberAccount.h"
#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloSignedDocument.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/VTCConfiguration.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "VantorSyncManager/Value.h"
