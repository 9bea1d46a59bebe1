// One computer of an account in a test: a home folder of its own, and
// nubilosyncclient run there as a separate process, as a person would run
// it. Its contacts and calendars folders are vdir folders in that home.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::local {

class Computer {
 public:
  struct Result {
    int status = -1;
    std::string out;
    std::string err;
    double cpuSeconds = 0;   // user and system time of the run
    double seconds = 0;      // wall time (runMeasured)
    long peakKilobytes = 0;  // the most memory the run had resident (runMeasured)
    bool timedOut = false;   // killed at the time limit; err ends with its threads' stacks
  };

  // A run still going after this long is taken to hang: finish() notes the
  // stacks of its threads (where gdb is installed) and kills it.
  static constexpr int kTimeLimitSeconds = 120;

  // A fresh home whose per-host preferences name the computer.
  explicit Computer(const std::string& name);
  ~Computer();
  Computer(const Computer&) = delete;
  Computer& operator=(const Computer&) = delete;

  const std::string& name() const { return name_; }
  const std::string& home() const { return home_; }
  std::string contacts() const { return home_ + "/contacts"; }
  std::string calendars() const { return home_ + "/calendars"; }

  // Runs nubilosyncclient with these arguments and waits for it.
  Result run(const std::vector<std::string>& args, const std::string& input = {}) const;
  // The same, measured by GNU time: the run's own wall time and peak memory
  // (a child forked from the test would count the test's pages as its own).
  Result runMeasured(const std::vector<std::string>& args) const;
  // Runs it on a pseudo-terminal, as a person at a terminal would; out holds
  // everything it drew there.
  Result runOnTerminal(const std::vector<std::string>& args) const;
  // Starts it without waiting; finish() waits and collects.
  pid_t start(const std::vector<std::string>& args) const;
  Result finish(pid_t pid) const;

  // setup against the share with a password command that reads a file of
  // the home (the password is on no command line), then the two folders.
  // More arguments go to setup; --allow-insecure is added for a plain
  // http:// share or mqtt:// push server.
  void join(const std::string& url, const std::string& user, const std::string& password,
            const std::vector<std::string>& moreSetup = {}) const;

  // Writes passphrase into a file of the home and gives the setup
  // arguments of a passphrase command that prints it.
  std::vector<std::string> passphraseArguments(const std::string& passphrase) const;

  // Sets an environment variable of the client's processes (PATH, for one).
  void setEnvironment(const std::string& name, const std::string& value);
  // Gives the client's processes no more address space than this (0: no limit).
  void setAddressSpaceLimit(uint64_t bytes) { addressSpace_ = bytes; }

  // This computer's per-host preference file (it has a machine id of its own).
  std::string perHostFile() const;
  // Sets a per-host preference (the configuration's last layer); call it
  // while no client runs on this computer.
  void setPreference(const std::string& key, const Value& value) const;

  // The item files of a folder, name -> content.
  static std::map<std::string, std::string> files(const std::string& folder);
  static void write(const std::string& path, const std::string& content);
  static std::string read(const std::string& path);

 private:
  std::vector<std::string> environment() const;
  struct Exec;  // a prepared command line
  // Starts the client with standard input read from the file input.
  pid_t spawn(const std::vector<std::string>& args, const std::string& input) const;
  std::string name_;
  std::string home_;
  std::string machineId_;
  std::map<std::string, std::string> environment_;
  uint64_t addressSpace_ = 0;
};

// The path of the built nubilosyncclient.
std::string clientProgram();

}  // namespace vtc::local
