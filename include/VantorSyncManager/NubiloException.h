// The one exception type that crosses the library's boundary. Callers test a
// failure by comparing name() with one of the failure-name constants.
#pragma once

#include <exception>
#include <string>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

class VSM_EXPORT NubiloException : public std::exception {
 public:
  NubiloException(std::string name, std::string reason, vtc::Dictionary userInfo = {});

  const std::string& name() const { return name_; }
  const std::string& reason() const { return reason_; }
  const vtc::Dictionary& userInfo() const { return userInfo_; }
  const char* what() const noexcept override { return what_.c_str(); }
  std::string description() const { return name_ + ": " + reason_; }

 private:
  std::string name_;
  std::string reason_;
  vtc::Dictionary userInfo_;
  std::string what_;
};
