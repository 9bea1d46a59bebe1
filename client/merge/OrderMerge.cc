#include "client/merge/OrderMerge.h"

#include <algorithm>
#include <unordered_set>

namespace vtc::client::merge {

namespace {

using Keys = std::vector<std::string>;

Keys restricted(const Keys& list, const std::unordered_set<std::string>& to) {
  Keys out;
  std::unordered_set<std::string> seen;
  for (const std::string& k : list)
    if (to.count(k) && seen.insert(k).second) out.push_back(k);
  return out;
}

}  // namespace

Keys mergeOrder(const Keys& base, const Keys& ours, const Keys& theirs, const Keys& keys) {
  const std::unordered_set<std::string> wanted(keys.begin(), keys.end());
  const std::unordered_set<std::string> inBase(base.begin(), base.end());
  const std::unordered_set<std::string> inTheirs(theirs.begin(), theirs.end());
  // Theirs moved units when its order of the keys both had differs from
  // base's; otherwise ours is the order to keep, and theirs adds to it.
  const bool theirsMoved = restricted(theirs, inBase) != restricted(base, inTheirs);
  const Keys& skeleton = theirsMoved ? theirs : ours;
  const Keys& other = theirsMoved ? ours : theirs;

  Keys result = restricted(skeleton, wanted);
  std::unordered_set<std::string> placed(result.begin(), result.end());
  for (size_t i = 0; i < other.size(); ++i) {
    const std::string& key = other[i];
    if (!wanted.count(key) || placed.count(key)) continue;
    // After the nearest key before it that is placed; else before the
    // nearest one after it; else at the end.
    auto at = result.end();
    bool found = false;
    for (size_t j = i; j-- > 0 && !found;)
      if (placed.count(other[j])) {
        at = std::find(result.begin(), result.end(), other[j]) + 1;
        found = true;
      }
    for (size_t j = i + 1; j < other.size() && !found; ++j)
      if (placed.count(other[j])) {
        at = std::find(result.begin(), result.end(), other[j]);
        found = true;
      }
    result.insert(at, key);
    placed.insert(key);
  }
  return result;
}

}  // namespace vtc::client::merge
