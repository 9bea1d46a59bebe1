#include "VantorSyncManager/NubiloException.h"

NubiloException::NubiloException(std::string name, std::string reason, vtc::Dictionary userInfo)
    : name_(std::move(name)),
      reason_(std::move(reason)),
      userInfo_(std::move(userInfo)),
      what_(name_ + ": " + reason_) {}
