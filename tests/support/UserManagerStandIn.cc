#include "support/UserManagerStandIn.h"

#include <algorithm>

#include "platform/jobs/Crontab.h"
#include "platform/jobs/UserManager.h"

namespace vtc::test {

namespace {

std::string joined(const std::vector<std::string>& arguments) {
  std::string text;
  for (const std::string& a : arguments) text += (text.empty() ? "" : " ") + a;
  return text;
}

}  // namespace

UserManagerStandIn::UserManagerStandIn() {
  jobs::systemctlSeam().install([this](const std::vector<std::string>& arguments) {
    std::lock_guard<std::mutex> lock(mutex_);
    calls_.push_back(joined(arguments));
    process::CommandResult r;
    r.status = status_;
    r.err = message_;
    const auto has = [&](const char* a) { return std::ranges::count(arguments, a) > 0; };
    const bool starts = has("start") || (has("enable") && has("--now"));
    if (r.status == 0 && jobsFail_ && starts && !has("--no-block")) {
      r.status = 1;
      r.err = "Job for " + arguments.back() +
              " failed because the control process exited with error code.\n";
    }
    return r;
  });
  jobs::crontabSeam().install(
      [this](const std::vector<std::string>& arguments, const std::string& input) {
        std::lock_guard<std::mutex> lock(mutex_);
        crontabCalls_.push_back(joined(arguments));
        process::CommandResult r;
        if (!crontabInstalled) return r;  // status 127: no such program
        if (arguments == std::vector<std::string>{"-l"}) {
          r.status = crontab ? 0 : 1;
          if (crontab)
            r.out = *crontab;
          else
            r.err = "no crontab for user\n";
        } else if (arguments == std::vector<std::string>{"-"}) {
          crontab = input;
          r.status = 0;
        }
        return r;
      });
}

UserManagerStandIn::~UserManagerStandIn() {
  jobs::systemctlSeam().install(nullptr);
  jobs::crontabSeam().install(nullptr);
}

std::vector<std::string> UserManagerStandIn::calls() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return calls_;
}

void UserManagerStandIn::forgetCalls() {
  std::lock_guard<std::mutex> lock(mutex_);
  calls_.clear();
}

void UserManagerStandIn::refuse(int status, const std::string& message) {
  std::lock_guard<std::mutex> lock(mutex_);
  status_ = status;
  message_ = message;
}

std::vector<std::string> UserManagerStandIn::crontabCalls() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return crontabCalls_;
}

}  // namespace vtc::test
