#include "localshare/Computer.h"

#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "common/Uuid.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"
#include "platform/process/Command.h"

extern char** environ;

namespace vtc::local {

std::string clientProgram() {
  return VSM_CLIENT_PROGRAM;
}

Computer::Computer(const std::string& name) : name_(name) {
  std::string tmpl = paths::join(paths::temporaryDirectory(), "vsm-computer-XXXXXX");
  home_ = ::mkdtemp(tmpl.data());
  // A machine of its own: per-host files and the host UUID of reports.
  std::string id = makeUUIDString();
  id.erase(std::remove(id.begin(), id.end(), '-'), id.end());
  std::transform(id.begin(), id.end(), id.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  machineId_ = id;
  write(home_ + "/.machine-id", id + "\n");
  std::filesystem::create_directories(std::filesystem::path(perHostFile()).parent_path());
  plist::writeFileAtomically(perHostFile(),
                             Value(Dictionary{{"ClientName", name}, {"LoggingLevel", "info"}}));
}

std::string Computer::perHostFile() const {
  return home_ + "/Library/Preferences/ByHost/com.korvo.VantorSync." + machineId_ + ".plist";
}

void Computer::setPreference(const std::string& key, const Value& value) const {
  Value all = plist::readFile(perHostFile()).value_or(Value(Dictionary{}));
  all.mutableDictionary().set(key, value);
  plist::writeFileAtomically(perHostFile(), all);
}

Computer::~Computer() {
  std::error_code ignored;
  std::filesystem::remove_all(home_, ignored);
}

std::vector<std::string> Computer::environment() const {
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    std::string entry = *e;
    if (entry.starts_with("HOME=") || entry.starts_with("XDG_") || entry.starts_with("NUBILO_"))
      continue;
    env.push_back(entry);
  }
  env.push_back("HOME=" + home_);
  env.push_back("NUBILO_MACHINE_ID_FILE=" + home_ + "/.machine-id");
  env.push_back("NUBILO_WAIT_SCALE=0.001");  // protocol waits of a thousandth
  for (const auto& [name, value] : environment_) {
    std::erase_if(env, [&](const std::string& e) { return e.starts_with(name + "="); });
    env.push_back(name + "=" + value);
  }
  return env;
}

pid_t Computer::start(const std::vector<std::string>& args) const {
  return spawn(args, "/dev/null");
}

// The client's command line and environment, made before fork(): the child
// of a process with threads may only call async-signal-safe functions, and
// allocating is not one.
struct Computer::Exec {
  std::vector<std::string> argv, env;
  std::vector<char*> cargv, cenv;
  Exec(const std::vector<std::string>& args, std::vector<std::string> environment,
       std::vector<std::string> before = {})
      : argv(std::move(before)), env(std::move(environment)) {
    // A profiler or debugger the client runs under, for measurements:
    // VSM_CLIENT_WRAPPER="valgrind --tool=callgrind".
    if (const char* wrapper = std::getenv("VSM_CLIENT_WRAPPER")) {
      std::istringstream words(wrapper);
      for (std::string word; words >> word;) argv.push_back(word);
    }
    argv.push_back(clientProgram());
    argv.insert(argv.end(), args.begin(), args.end());
    for (auto& a : argv) cargv.push_back(a.data());
    cargv.push_back(nullptr);
    for (auto& v : env) cenv.push_back(v.data());
    cenv.push_back(nullptr);
  }
  [[noreturn]] void run(uint64_t addressSpace = 0) const {
    if (addressSpace > 0) {
      const rlimit limit{addressSpace, addressSpace};
      ::setrlimit(RLIMIT_AS, &limit);
    }
    ::execve(cargv[0], cargv.data(), cenv.data());
    ::_exit(127);
  }
};

pid_t Computer::spawn(const std::vector<std::string>& args, const std::string& input) const {
  const std::string out = home_ + "/.last-out", err = home_ + "/.last-err";
  const Exec exec(args, environment());
  pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(::open(input.c_str(), O_RDONLY), 0);  // a file: never a terminal
    ::dup2(::open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
    ::dup2(::open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
    exec.run(addressSpace_);
  }
  return pid;
}

namespace {

// Whether the process ends within the time limit (a pidfd turns readable when
// it does).
bool endsInTime(pid_t pid) {
  const int fd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
  if (fd < 0) return true;  // already reaped or no pidfds: wait4 decides
  pollfd p{fd, POLLIN, 0};
  int ready;
  do ready = ::poll(&p, 1, Computer::kTimeLimitSeconds * 1000);
  while (ready < 0 && errno == EINTR);
  ::close(fd);
  return ready != 0;
}

// What every thread of a live process is doing: its state and kernel wait
// channel, and the stacks from gdb where it is installed and may attach.
std::string threadStacks(pid_t pid) {
  std::string text;
  const std::string task = "/proc/" + std::to_string(pid) + "/task";
  std::error_code error;
  for (auto it = std::filesystem::directory_iterator(task, error);
       !error && it != std::filesystem::directory_iterator(); it.increment(error)) {
    const std::string stat = Computer::read(it->path() / "stat");
    const size_t state = stat.rfind(')');
    text += "thread " + it->path().filename().string() + ": state " +
            (state == std::string::npos ? "?" : stat.substr(state + 2, 1)) + ", waiting in " +
            Computer::read(it->path() / "wchan") + "\n";
  }
  const process::CommandResult gdb =
      process::run({"gdb", "-p", std::to_string(pid), "-batch", "-ex", "thread apply all bt"});
  if (gdb.status != 127) text += gdb.out + gdb.err;
  return text;
}

}  // namespace

Computer::Result Computer::finish(pid_t pid) const {
  Result r;
  std::string stacks;
  if (!endsInTime(pid)) {
    r.timedOut = true;
    stacks = threadStacks(pid);
    ::kill(pid, SIGKILL);
  }
  int status = 0;
  struct rusage usage {};
  ::wait4(pid, &status, 0, &usage);
  r.cpuSeconds = static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
                 static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;

  r.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  r.out = read(home_ + "/.last-out");
  r.err = read(home_ + "/.last-err");
  if (r.timedOut)
    r.err += "\n(still running after " + std::to_string(kTimeLimitSeconds) +
             " s, killed; its threads were:)\n" + stacks;
  return r;
}

Computer::Result Computer::run(const std::vector<std::string>& args,
                               const std::string& input) const {
  if (input.empty()) return finish(start(args));
  const std::string inputFile = home_ + "/.last-in";
  write(inputFile, input);
  return finish(spawn(args, inputFile));
}

Computer::Result Computer::runMeasured(const std::vector<std::string>& args) const {
  const std::string usage = home_ + "/.last-usage";
  const Exec exec(args, environment(), {"/usr/bin/time", "-q", "-f", "%e %M", "-o", usage});
  const std::string out = home_ + "/.last-out", err = home_ + "/.last-err";
  pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(::open("/dev/null", O_RDONLY), 0);
    ::dup2(::open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 1);
    ::dup2(::open(err.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644), 2);
    exec.run(addressSpace_);
  }
  Result r = finish(pid);
  std::istringstream(read(usage)) >> r.seconds >> r.peakKilobytes;
  return r;
}

Computer::Result Computer::runOnTerminal(const std::vector<std::string>& args) const {
  std::vector<std::string> env = environment();
  env.push_back("TERM=xterm");
  const Exec exec(args, std::move(env));
  int terminal = -1;
  pid_t pid = ::forkpty(&terminal, nullptr, nullptr, nullptr);
  if (pid == 0) exec.run();
  Result r;
  char buffer[4096];
  for (ssize_t n; (n = ::read(terminal, buffer, sizeof buffer)) > 0;) r.out.append(buffer, n);
  ::close(terminal);
  int status = 0;
  ::waitpid(pid, &status, 0);
  r.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  return r;
}

void Computer::setEnvironment(const std::string& name, const std::string& value) {
  environment_[name] = value;
}

std::vector<std::string> Computer::passphraseArguments(const std::string& passphrase) const {
  const std::string file = home_ + "/.passphrase";
  write(file, passphrase + "\n");
  ::chmod(file.c_str(), 0600);
  return {"--passphrase-command", "cat '" + file + "'"};
}

void Computer::join(const std::string& url, const std::string& user, const std::string& password,
                    const std::vector<std::string>& moreSetup) const {
  const std::string passwordFile = home_ + "/.password";
  write(passwordFile, password + "\n");
  ::chmod(passwordFile.c_str(), 0600);
  std::vector<std::string> setup{
      "setup", url, "--user", user, "--password-command", "cat '" + passwordFile + "'"};
  setup.insert(setup.end(), moreSetup.begin(), moreSetup.end());
  // The tests' plain shares and brokers listen on loopback: the password
  // crosses no network, and the person at the keyboard says so.
  bool plain = url.starts_with("http://");
  for (const std::string& arg : moreSetup) plain = plain || arg.starts_with("mqtt://");
  if (plain && std::find(setup.begin(), setup.end(), "--allow-insecure") == setup.end())
    setup.push_back("--allow-insecure");
  for (const auto& args : std::vector<std::vector<std::string>>{
           setup, {"add", "contacts", contacts()}, {"add", "calendars", calendars()}}) {
    Result r = run(args);
    if (r.status != 0)
      throw std::runtime_error(name_ + ": nubilosyncclient failed: " + r.err + r.out);
  }
}

std::map<std::string, std::string> Computer::files(const std::string& folder) {
  std::map<std::string, std::string> all;
  std::error_code error;
  for (auto it = std::filesystem::directory_iterator(folder, error);
       !error && it != std::filesystem::directory_iterator(); it.increment(error)) {
    const std::string name = it->path().filename().string();
    if (name.starts_with(".") || !it->is_regular_file()) continue;
    all[name] = read(it->path().string());
  }
  return all;
}

void Computer::write(const std::string& path, const std::string& content) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path, std::ios::binary) << content;
}

std::string Computer::read(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

}  // namespace vtc::local
