#include "client/stores/VdirCollection.h"

namespace vtc::client {

Value ItemState::toValue() const {
  return Value(Dictionary{{"size", size},
                          {"modifiedNanoseconds", modifiedNanoseconds},
                          {"changedNanoseconds", changedNanoseconds},
                          {"inode", static_cast<int64_t>(inode)},
                          {"fields", fields}});
}

std::optional<ItemState> ItemState::fromValue(const Value& value) {
  const Dictionary& d = value.dictionary();
  const char* const numbers[] = {"size", "modifiedNanoseconds", "changedNanoseconds", "inode"};
  for (const char* key : numbers)
    if (d.get(key).kind() != Value::Kind::Integer) return std::nullopt;
  if (!d.get("fields").isDictionary()) return std::nullopt;
  ItemState state;
  state.size = d.get("size").integer();
  state.modifiedNanoseconds = d.get("modifiedNanoseconds").integer();
  state.changedNanoseconds = d.get("changedNanoseconds").integer();
  state.inode = static_cast<uint64_t>(d.get("inode").integer());
  state.fields = d.get("fields").dictionary();
  return state;
}

bool ItemState::sameFileAs(const ItemState& other) const {
  return size == other.size && modifiedNanoseconds == other.modifiedNanoseconds &&
         changedNanoseconds == other.changedNanoseconds && inode == other.inode;
}

}  // namespace vtc::client
