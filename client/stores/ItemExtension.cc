#include "client/stores/VdirItem.h"

namespace vtc::client {

const char* itemExtension(ItemKind kind) {
  return kind == ItemKind::Contacts ? ".vcf" : ".ics";
}

}  // namespace vtc::client
