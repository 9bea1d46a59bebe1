// Whether an item's bytes are something the programs that read vdir
// folders take: its frame and content lines; a vCard's VERSION and FN; an
// iCalendar object as libical reads it, and what libical does not check
// (an event or to-do that ends before it starts).
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "client/stores/VdirItem.h"

namespace vtc::client {

// The item's problems, each a few words; none for a good item.
std::vector<std::string> itemProblems(ItemKind kind, std::string_view bytes);

// A problem of `merged` that none of the items it came from has (a merge
// may keep the faults of its inputs, never add one); none when there is
// no such problem.
std::optional<std::string> newProblem(ItemKind kind, std::string_view merged,
                                      const std::vector<std::string_view>& inputs);

}  // namespace vtc::client
