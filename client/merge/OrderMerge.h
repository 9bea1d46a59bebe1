// The order of an item's units after two computers changed it: every key
// in `keys` exactly once, in the order `theirs` gives, with the keys that
// only `ours` placed put after the key that comes before them in `ours`.
// base says which keys ours added (those not in base); keys neither list
// holds go last. A pure function of its arguments.
#pragma once

#include <string>
#include <vector>

namespace vtc::client::merge {

std::vector<std::string> mergeOrder(const std::vector<std::string>& base,
                                    const std::vector<std::string>& ours,
                                    const std::vector<std::string>& theirs,
                                    const std::vector<std::string>& keys);

}  // namespace vtc::client::merge
