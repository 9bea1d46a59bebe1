#include "localshare/Processes.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <stdexcept>
#include <thread>

namespace vtc::local {

namespace {

sockaddr_in loopback(int port) {
  return {AF_INET, htons(static_cast<uint16_t>(port)), {htonl(INADDR_LOOPBACK)}, {}};
}

}  // namespace

pid_t startProcess(const std::vector<std::string>& argv, const std::string& input) {
  std::vector<char*> args;
  for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
  args.push_back(nullptr);
  int in[2];
  if (::pipe2(in, O_CLOEXEC) != 0) throw std::runtime_error("pipe failed");
  pid_t pid = ::fork();
  if (pid == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);  // a test process that crashes takes it along
    // A group of its own: a server that stops its workers by signalling its
    // process group (Apache with worker processes does) must not hit the test.
    ::setsid();
    int devnull = ::open("/dev/null", O_WRONLY);
    ::dup2(in[0], 0);
    ::dup2(devnull, 1);
    ::dup2(devnull, 2);
    ::execvp(args[0], args.data());
    ::_exit(127);
  }
  ::close(in[0]);
  (void)!::write(in[1], input.data(), input.size());  // a pipe takes this much at once
  ::close(in[1]);
  return pid;
}

void stopProcess(pid_t& pid) {
  if (pid <= 0) return;
  // The whole group: a server's workers end with it even when it does not
  // stop them itself (PHP's built-in server does not). The leader is reaped
  // last, so that its group id cannot be given to anyone else meanwhile.
  ::kill(-pid, SIGTERM);
  // Whether the leader ended in time or not, SIGKILL follows: for members
  // that outlive it, or for all of them.
  waitUntil([&] {
    siginfo_t info{};
    return ::waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid == pid;
  });
  ::kill(-pid, SIGKILL);
  ::waitpid(pid, nullptr, 0);
  pid = -1;
}

bool waitUntil(const std::function<bool()>& ready) {
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (std::chrono::steady_clock::now() < deadline) {
    if (ready()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return false;
}

int connectLoopback(int port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr = loopback(port);
  if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) return fd;
  ::close(fd);
  return -1;
}

int listenLoopback(int& port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr = loopback(0);
  socklen_t len = sizeof addr;
  if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), len) != 0 || ::listen(fd, 16) != 0 ||
      ::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0)
    throw std::runtime_error("cannot listen on 127.0.0.1");
  port = ntohs(addr.sin_port);
  return fd;
}

}  // namespace vtc::local
