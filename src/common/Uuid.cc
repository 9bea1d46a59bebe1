#include "common/Uuid.h"

#include <sys/random.h>

#include <cerrno>
#include <cstdio>
#include <random>

namespace vtc {

std::string makeUUIDString() {
  // The kernel's generator: no library state to set up for sixteen bytes
  // (starting OpenSSL's generator costs a process a few milliseconds).
  unsigned char b[16];
  ssize_t got = 0;
  do {
    got = ::getrandom(b, sizeof b, 0);
  } while (got < 0 && errno == EINTR);
  if (got != static_cast<ssize_t>(sizeof b)) {
    std::random_device rd;
    for (auto& x : b) x = static_cast<unsigned char>(rd());
  }
  b[6] = static_cast<unsigned char>((b[6] & 0x0F) | 0x40);
  b[8] = static_cast<unsigned char>((b[8] & 0x3F) | 0x80);
  char out[37];
  std::snprintf(out, sizeof out,
                "%02X%02X%02X%02X-%02X%02X-%02X%02X-%02X%02X-%02X%02X%02X%02X%02X%02X", b[0], b[1],
                b[2], b[3], b[4], b[5], b[6], b[7], b[8], b[9], b[10], b[11], b[12], b[13], b[14],
                b[15]);
  return out;
}

}  // namespace vtc
