// Whether a dataclass changed on the server since the caller last looked.
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/dav/DavPaths.h"

namespace {

// Apache reports a collection's tag as weak for about a second after a
// change and strong after: both forms name the same state.
std::string_view withoutWeakPrefix(std::string_view tag) {
  return tag.starts_with("W/") ? tag.substr(2) : tag;
}

}  // namespace

bool NubiloRemoteSession::eTagChangedForDataclass(const std::string& dataclass,
                                                  const std::string& previousETag) {
  const std::string path = vtc::davpath::collection(dataclassPath(dataclass));
  DavTransaction t = _issuePropFindWithRetryAtPath(path, kDAVZeroDepth, {"DAV:getetag"});
  if (!t.isSuccessful()) return true;
  const vtc::Dictionary& result = t.result().dictionary();
  if (result.empty()) return true;
  const vtc::Dictionary& props = std::prev(result.end())->second.dictionary();
  const vtc::Value* current = props.find("DAV:getetag");
  if (previousETag == vtc::kNoETag && !current) return false;
  if (current && withoutWeakPrefix(previousETag) == withoutWeakPrefix(current->string()))
    return false;
  VTC_LOG_INFO("eTags are different previous:%@ current:%@", previousETag,
               current ? current->string() : std::string("(null)"));
  return true;
}
