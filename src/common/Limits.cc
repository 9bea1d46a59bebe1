#include "common/Limits.h"

#include <algorithm>
#include <mutex>

#include "common/Format.h"

namespace vtc {

namespace {

std::mutex gMutex;
Limits gLimits;

constexpr std::string_view kLimitWords = "(the limit ";

// The value of key in the configuration, in bytes, when it is a positive
// number of units.
void take(const Dictionary& configuration, const char* key, uint64_t unit, uint64_t& into) {
  const Value& v = configuration.get(key);
  const double n = v.isString() ? std::atof(v.string().c_str()) : v.real();
  if (n > 0 && n < 1e12) into = static_cast<uint64_t>(n * static_cast<double>(unit));
}

}  // namespace

uint64_t Limits::inflateBudget(uint64_t compressed) const {
  const uint64_t relative =
      compressed > UINT64_MAX / inflateRatio ? UINT64_MAX : compressed * inflateRatio;
  return std::min(inflatedBytes, std::max(kInflateFloor, relative));
}

uint64_t Limits::decodeBudget(uint64_t compressed) const {
  const uint64_t relative =
      compressed > UINT64_MAX / kDecodedPerByte ? UINT64_MAX : compressed * kDecodedPerByte;
  return std::min(decodedBytes, std::max(kDecodedFloor, relative));
}

Limits Limits::fromConfiguration(const Dictionary& configuration) {
  Limits l;
  take(configuration, kChangelogKey, 1 << 20, l.changelogBytes);
  take(configuration, kInflateRatioKey, 1, l.inflateRatio);
  take(configuration, kInflatedKey, 1 << 20, l.inflatedBytes);
  take(configuration, kDecodedKey, 1 << 20, l.decodedBytes);
  take(configuration, kAnswerKey, 1 << 20, l.answerBytes);
  take(configuration, kPushMessageKey, 1 << 10, l.pushMessageBytes);
  take(configuration, kConfigurationKey, 1 << 10, l.configurationBytes);
  l.inflateRatio = std::max<uint64_t>(l.inflateRatio, 1);
  return l;
}

const Limits& limits() {
  // Set when the configuration is built, before requests start; readers
  // take no lock.
  return gLimits;
}

void setLimits(const Limits& limits) {
  std::lock_guard<std::mutex> lock(gMutex);
  gLimits = limits;
}

std::string byteCountText(uint64_t bytes) {
  if (bytes < (1 << 10)) return format("%llu bytes", static_cast<unsigned long long>(bytes));
  const char* units[] = {"KB", "MB", "GB", "TB"};
  double n = static_cast<double>(bytes) / 1024;
  size_t unit = 0;
  while (n >= 1024 && unit + 1 < std::size(units)) {
    n /= 1024;
    ++unit;
  }
  return n == static_cast<double>(static_cast<uint64_t>(n)) || n >= 100
             ? format("%.0f %s", n, units[unit])
             : format("%.1f %s", n, units[unit]);
}

std::string overLimitText(std::string_view what, uint64_t allowedBytes, std::string_view key) {
  return format("%@ is larger than %@ %@%@)", what, byteCountText(allowedBytes), kLimitWords, key);
}

std::optional<OverLimit> overLimitIn(std::string_view text) {
  constexpr std::string_view kLarger = " more than ";
  const size_t at = text.find(kLimitWords);
  if (at == std::string_view::npos) return std::nullopt;
  const size_t start = at + kLimitWords.size();
  const size_t end = text.find(')', start);
  if (end == std::string_view::npos) return std::nullopt;
  OverLimit found{"", std::string(text.substr(start, end - start))};
  const std::string_view before = text.substr(0, at);
  if (const size_t larger = before.rfind(" larger than "); larger != std::string_view::npos)
    found.allowed = std::string(before.substr(larger + 13));
  else if (const size_t more = before.rfind(kLarger); more != std::string_view::npos)
    found.allowed = std::string(before.substr(more + kLarger.size()));
  while (!found.allowed.empty() && found.allowed.back() == ' ') found.allowed.pop_back();
  return found;
}

}  // namespace vtc
