#include "support/LogCapture.h"

#include <cctype>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "common/Logging.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::test {

namespace {

constexpr const char* kDomain = "com.korvo.VantorSync";

// "2011-03-04 10:15:02:117": the timestamp that opens every line.
bool isTimestamp(std::string_view field) {
  static constexpr std::string_view kShape = "dddd-dd-dd dd:dd:dd:ddd";
  if (field.size() != kShape.size()) return false;
  for (size_t i = 0; i < field.size(); ++i) {
    bool digit = std::isdigit(static_cast<unsigned char>(field[i]));
    if ((kShape[i] == 'd') != digit || (kShape[i] != 'd' && field[i] != kShape[i])) return false;
  }
  return true;
}

bool isHex(std::string_view field) {
  if (field.empty()) return false;
  for (char c : field)
    if (!std::isxdigit(static_cast<unsigned char>(c))) return false;
  return true;
}

// Splits off the text up to the next '|'; false when there is none.
bool takeField(std::string_view& rest, std::string_view& field) {
  size_t bar = rest.find('|');
  if (bar == std::string_view::npos) return false;
  field = rest.substr(0, bar);
  rest.remove_prefix(bar + 1);
  return true;
}

}  // namespace

LogCapture::LogCapture(const std::string& level) {
  auto& store = prefs::PreferenceStore::shared();
  store.setValue("LoggingLevel", Value(level), kDomain, prefs::Scope::AnyHost);
  store.synchronize(kDomain, prefs::Scope::AnyHost);
  log::resetForTesting();
  std::error_code missing;
  uintmax_t size = std::filesystem::file_size(log::logFilePath(), missing);
  start_ = missing ? 0 : size;
}

LogCapture::~LogCapture() {
  log::resetForTesting();
}

std::vector<LogCapture::Line> LogCapture::lines() const {
  std::ifstream in(log::logFilePath(), std::ios::binary);
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  // A log rolled away since the start is read from its beginning.
  text.erase(0, text.size() >= start_ ? start_ : 0);

  std::vector<Line> out;
  size_t pos = 0;
  while (pos < text.size()) {
    size_t end = text.find('\n', pos);
    if (end == std::string::npos) end = text.size();
    std::string_view rest(text.data() + pos, end - pos);
    pos = end + 1;
    // Short form: time|thread|level|message. Long form (debug):
    // time|file:line function|thread|level|message.
    std::string_view stamp, second, level;
    std::string_view probe = rest;
    bool parsed = takeField(probe, stamp) && isTimestamp(stamp) && takeField(probe, second);
    if (parsed && !isHex(second)) parsed = takeField(probe, second) && isHex(second);
    parsed = parsed && takeField(probe, level);
    if (parsed) {
      out.push_back({std::string(level), std::string(probe)});
    } else if (!out.empty()) {
      out.back().message += "\n" + std::string(rest);  // a message with a line break
    }
  }
  return out;
}

std::vector<std::string> LogCapture::messages(const std::string& level) const {
  std::vector<std::string> out;
  for (const Line& line : lines())
    if (line.level == level) out.push_back(line.message);
  return out;
}

size_t LogCapture::count(const std::string& level, const std::string& message) const {
  size_t n = 0;
  for (const Line& line : lines()) n += line.level == level && line.message == message;
  return n;
}

}  // namespace vtc::test
