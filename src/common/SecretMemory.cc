#include "common/SecretMemory.h"

#include <sys/prctl.h>

#include <cstring>
#include <mutex>

namespace vtc {

namespace {

std::mutex gMutex;
int gHolds = 0;
int gBefore = 1;  // the dumpable state before the first hold

void take() {
  std::lock_guard<std::mutex> lock(gMutex);
  if (gHolds++ == 0) {
    gBefore = ::prctl(PR_GET_DUMPABLE);
    ::prctl(PR_SET_DUMPABLE, 0);
  }
}

}  // namespace

SecretHold::SecretHold() {
  take();
}

SecretHold::SecretHold(const SecretHold&) {
  take();
}

SecretHold::~SecretHold() {
  std::lock_guard<std::mutex> lock(gMutex);
  if (--gHolds == 0 && gBefore > 0) ::prctl(PR_SET_DUMPABLE, gBefore);
}

bool processIsDumpable() {
  return ::prctl(PR_GET_DUMPABLE) > 0;
}

void wipe(std::string& text) {
  // explicit_bzero is not optimised away, whatever follows.
  text.resize(text.capacity());
  ::explicit_bzero(text.data(), text.size());
  text.clear();
}

}  // namespace vtc
