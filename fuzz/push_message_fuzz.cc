// Feeds arbitrary bytes, as a push message from the broker, to the push
// message decoder. It may find no guid in them, but must never crash, hang
// or go beyond the push message cap in what it builds.
#include "platform/push/PushMessage.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  vtc::push::decodePushMessage(vtc::ByteView(data, size));
  return 0;
}
