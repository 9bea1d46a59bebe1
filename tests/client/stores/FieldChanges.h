// Property changes as the sync engine hands them over, for the vdir tests.
#pragma once

#include <string>
#include <utility>

#include "VantorSyncManager/Value.h"

namespace vtc::test {

inline Value setField(std::string name, std::string lines) {
  return Value(
      Dictionary{{"action", "set"}, {"name", std::move(name)}, {"value", std::move(lines)}});
}

inline Value clearField(std::string name) {
  return Value(Dictionary{{"action", "clear"}, {"name", std::move(name)}});
}

// Sets of every field, as a computer that has never seen the item sends them.
inline Array setsOf(const Dictionary& fields) {
  Array changes;
  for (const auto& [key, value] : fields) changes.push_back(setField(key, value.string()));
  return changes;
}

}  // namespace vtc::test
