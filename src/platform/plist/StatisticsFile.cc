// VTCLogStatistics: the per-user statistics file, merged and replaced whole.
#include "VantorSyncManager/Diagnostics.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"

VSM_EXPORT bool VTCLogStatistics(const vtc::Dictionary& statistics) {
  std::string path = vtc::paths::expandTilde("~/Library/Logs/Sync/nubilosyncstats.plist");
  vtc::paths::makeDirectories(path.substr(0, path.find_last_of('/')));
  vtc::Dictionary merged;
  // An unreadable file is replaced by the caller's entries alone.
  if (std::optional<vtc::Value> existing = vtc::plist::readFile(path);
      existing && existing->isDictionary())
    merged = existing->dictionary();
  merged.merge(statistics);
  return vtc::plist::writeFileAtomically(path, vtc::Value(std::move(merged)));
}
