#include "platform/os/HostIdentity.h"

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <mutex>

namespace vtc::os {

namespace {

std::mutex gMutex;
std::string gProductUuidFile;
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

// 32 hex digits, with or without the four dashes, as upper-case 8-4-4-4-12.
std::optional<std::string> uuidText(const std::string& text) {
  std::string hex;
  for (char c : text) {
    if (c == '-') continue;
    if (!std::isxdigit(static_cast<unsigned char>(c))) return std::nullopt;
    hex += static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  }
  if (hex.size() != 32) return std::nullopt;
  return hex.substr(0, 8) + "-" + hex.substr(8, 4) + "-" + hex.substr(12, 4) + "-" +
         hex.substr(16, 4) + "-" + hex.substr(20);
}

}  // namespace

std::string machineId() {
  int error = 0;
  const char* own = machineIdOverride();
  return firstLine(own ? own : fileOr(gMachineIdFile, "/etc/machine-id"), error).value_or("");
}

std::optional<std::string> hostUUID(int& error) {
  const char* own = machineIdOverride();
  int productError = 0;
  if (!own)
    if (auto product =
            firstLine(fileOr(gProductUuidFile, "/sys/class/dmi/id/product_uuid"), productError))
      if (auto uuid = uuidText(*product)) return uuid;
  error = 0;
  auto id = firstLine(own ? own : fileOr(gMachineIdFile, "/etc/machine-id"), error);
  if (!id) return std::nullopt;
  if (auto uuid = uuidText(*id)) return uuid;
  error = EINVAL;
  return std::nullopt;
}

void setIdentityFilesForTesting(std::string productUuidFile, std::string machineIdFile) {
  std::lock_guard<std::mutex> lock(gMutex);
  gProductUuidFile = std::move(productUuidFile);
  gMachineIdFile = std::move(machineIdFile);
}

}  // namespace vtc::os
