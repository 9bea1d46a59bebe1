#include "platform/os/HostIdentity.h"

#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <systemd/sd-id128.h>

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>

namespace vtc::os {

namespace {

// This application's id: what the machine id is keyed with.
constexpr sd_id128_t kApplicationId =
    SD_ID128_MAKE(7e, b9, 13, 0b, e7, 52, 4c, 43, 9f, bc, c1, 26, cf, 0c, 1b, 90);
constexpr const char* kSystemMachineId = "/etc/machine-id";

std::mutex gMutex;
std::string gMachineIdFile;

std::string fileOr(const std::string& chosen, const char* system) {
  std::lock_guard<std::mutex> lock(gMutex);
  return chosen.empty() ? system : chosen;
}

// Several homes on one machine that stand for computers of their own (the
// demo, tests) each name a machine-id file of their own.
const char* machineIdOverride() {
  const char* file = std::getenv("NUBILO_MACHINE_ID_FILE");
  return file && *file ? file : nullptr;
}

// The first line of a file, without trailing blanks; none (with errno) when
// it cannot be read.
std::optional<std::string> firstLine(const std::string& path, int& error) {
  errno = 0;
  std::ifstream in(path);
  std::string line;
  if (!in || !std::getline(in, line)) {
    error = errno ? errno : EIO;
    return std::nullopt;
  }
  while (!line.empty() && std::isspace(static_cast<unsigned char>(line.back()))) line.pop_back();
  return line;
}

// Upper-case 8-4-4-4-12 text of an id.
std::string uuidText(sd_id128_t id) {
  char text[SD_ID128_UUID_STRING_MAX];
  std::string out = sd_id128_to_uuid_string(id, text);
  for (char& c : out) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return out;
}

// What sd_id128_get_machine_app_specific gives for this machine id: the
// first half of HMAC-SHA256(key: the machine id, data: the application id),
// marked as a version 4 UUID.
sd_id128_t applicationSpecific(sd_id128_t machine) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  HMAC(EVP_sha256(), machine.bytes, sizeof machine.bytes, kApplicationId.bytes,
       sizeof kApplicationId.bytes, digest, &length);
  sd_id128_t out;
  std::memcpy(out.bytes, digest, sizeof out.bytes);
  out.bytes[6] = (out.bytes[6] & 0x0F) | 0x40;
  out.bytes[8] = (out.bytes[8] & 0x3F) | 0x80;
  return out;
}

}  // namespace

std::string machineId() {
  int error = 0;
  const char* own = machineIdOverride();
  return firstLine(own ? own : fileOr(gMachineIdFile, kSystemMachineId), error).value_or("");
}

std::optional<std::string> hostUUID(int& error) {
  const char* own = machineIdOverride();
  const std::string file = own ? own : fileOr(gMachineIdFile, kSystemMachineId);
  sd_id128_t derived;
  if (file == kSystemMachineId) {
    const int r = sd_id128_get_machine_app_specific(kApplicationId, &derived);
    if (r < 0) {
      error = -r;
      return std::nullopt;
    }
    return uuidText(derived);
  }
  error = 0;
  const std::optional<std::string> id = firstLine(file, error);
  if (!id) return std::nullopt;
  sd_id128_t machine;
  if (sd_id128_from_string(id->c_str(), &machine) < 0) {
    error = EINVAL;
    return std::nullopt;
  }
  return uuidText(applicationSpecific(machine));
}

void setIdentityFileForTesting(std::string machineIdFile) {
  std::lock_guard<std::mutex> lock(gMutex);
  gMachineIdFile = std::move(machineIdFile);
}

}  // namespace vtc::os
