// SMResult: error display and translation of the older design, now inert.
#include "VantorSyncManager/LegacySession.h"

void SMResult::displayErrors(const std::vector<int32_t>&) {}

void SMResult::displayError(int32_t) {}

void SMResult::displayErrorToUser(int32_t) {}

void SMResult::logError(int32_t) {}

std::optional<std::string> SMResult::localizedErrorFromCodeAndArgs(int32_t, ...) {
  return std::nullopt;
}

std::optional<std::string> SMResult::localizedErrorFromCode(int32_t) {
  return std::nullopt;
}

std::optional<std::string> SMResult::localizedString(const std::string&, const std::string&) {
  return std::nullopt;
}

std::optional<std::string> SMResult::localizedString(const std::string&, const std::string&,
                                                     const std::vector<std::string>&) {
  return std::nullopt;
}

std::optional<std::string> SMResult::translatedMessageFromCode(int32_t) {
  return std::nullopt;
}

std::optional<std::string> SMResult::localizedStringWithCode(int32_t) {
  return std::nullopt;
}

std::optional<std::string> SMResult::localizedString(const std::string&,
                                                     const std::vector<std::string>&) {
  return std::nullopt;
}

std::optional<std::string> SMResult::messageIdentifierFromCode(int32_t, const std::string&,
                                                               int32_t) {
  return std::nullopt;
}

int32_t SMResult::resultCodeFromPosixError(int) {
  return 1;
}
