#include "VantorSyncManager/SyncEngineChange.h"

#include "common/Format.h"

std::string SyncEngineChange::description() const {
  static const char* const kTypeNames[] = {"unknown", "add", "modify", "delete"};
  const char* name = type_ <= 3 ? kTypeNames[type_] : "unknown";
  return vtc::format("<SyncEngineChange %@ %@ %@>", name, recordIdentifier_, vtc::Value(changes_));
}
