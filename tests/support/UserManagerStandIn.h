// Stand-ins for the user manager's and cron's commands for one test: every
// `systemctl --user` call is recorded and answered (by default as a manager
// that does what it is told), and the crontab is a text in memory.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace vtc::test {

class UserManagerStandIn {
 public:
  UserManagerStandIn();  // installs itself
  ~UserManagerStandIn();

  // Each call's arguments (after "systemctl --user"), one string a call.
  std::vector<std::string> calls() const;
  void forgetCalls();
  // Later calls fail with this status and message.
  void refuse(int status, const std::string& message);
  // The jobs started from now on fail, as a sync that fails does: a start
  // that waits for its job (`--now` without `--no-block`) fails with it, as
  // the real manager's does.
  void failStartedJobs() { jobsFail_ = true; }

  // The crontab; none means the user has none. Without a crontab program
  // every crontab call fails as a missing program does.
  std::optional<std::string> crontab;
  bool crontabInstalled = true;
  std::vector<std::string> crontabCalls() const;

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> calls_;
  std::vector<std::string> crontabCalls_;
  int status_ = 0;
  std::string message_;
  bool jobsFail_ = false;
};

}  // namespace vtc::test
