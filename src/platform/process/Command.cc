#include "platform/process/Command.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

namespace vtc::process {

namespace {

int statusOf(int waitStatus) {
  if (WIFEXITED(waitStatus)) return WEXITSTATUS(waitStatus);
  if (WIFSIGNALED(waitStatus)) return 128 + WTERMSIG(waitStatus);
  return 127;
}

std::vector<char*> argvOf(const std::vector<std::string>& argv) {
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  return args;
}

// Writes input and reads both outputs at once, so that neither side of a
// chatty child fills its pipe and stalls.
void exchange(int in, int out, int err, const std::string& input, CommandResult& result) {
  size_t written = 0;
  if (input.empty()) {
    ::close(in);
    in = -1;
  }
  while (out >= 0 || err >= 0 || in >= 0) {
    pollfd fds[3] = {{in, POLLOUT, 0}, {out, POLLIN, 0}, {err, POLLIN, 0}};
    if (::poll(fds, 3, -1) < 0) {
      if (errno == EINTR) continue;
      break;
    }
    if (in >= 0 && fds[0].revents) {
      ssize_t n = ::write(in, input.data() + written, input.size() - written);
      if (n > 0) written += static_cast<size_t>(n);
      if (n <= 0 || written == input.size()) {
        ::close(in);
        in = -1;
      }
    }
    int* fdOf[2] = {&out, &err};
    std::string* textOf[2] = {&result.out, &result.err};
    for (int i = 0; i < 2; ++i) {
      if (*fdOf[i] < 0 || !fds[i + 1].revents) continue;
      char buffer[4096];
      ssize_t n = ::read(*fdOf[i], buffer, sizeof buffer);
      if (n > 0) {
        textOf[i]->append(buffer, static_cast<size_t>(n));
      } else if (n == 0 || errno != EINTR) {
        ::close(*fdOf[i]);
        *fdOf[i] = -1;
      }
    }
  }
  if (in >= 0) ::close(in);
}

}  // namespace

CommandResult run(const std::vector<std::string>& argv, const std::string& input) {
  CommandResult result;
  if (argv.empty()) return result;
  int in[2], out[2], err[2];
  if (::pipe2(in, O_CLOEXEC) != 0) return result;
  if (::pipe2(out, O_CLOEXEC) != 0) {
    ::close(in[0]), ::close(in[1]);
    return result;
  }
  if (::pipe2(err, O_CLOEXEC) != 0) {
    ::close(in[0]), ::close(in[1]), ::close(out[0]), ::close(out[1]);
    return result;
  }
  std::vector<char*> args = argvOf(argv);
  pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(in[0], 0);
    ::dup2(out[1], 1);
    ::dup2(err[1], 2);
    ::execvp(args[0], args.data());
    ::_exit(127);
  }
  ::close(in[0]), ::close(out[1]), ::close(err[1]);
  if (pid < 0) {
    ::close(in[1]), ::close(out[0]), ::close(err[0]);
    return result;
  }
  // A child that stops reading its input must not end this process.
  struct sigaction ignore {
  }, previous{};
  ignore.sa_handler = SIG_IGN;
  ::sigaction(SIGPIPE, &ignore, &previous);
  exchange(in[1], out[0], err[0], input, result);
  ::sigaction(SIGPIPE, &previous, nullptr);
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  result.status = statusOf(status);
  return result;
}

pid_t spawn(const std::vector<std::string>& argv) {
  if (argv.empty()) return -1;
  std::vector<char*> args = argvOf(argv);
  pid_t pid = ::fork();
  if (pid == 0) {
    int devnull = ::open("/dev/null", O_RDONLY);
    if (devnull >= 0) ::dup2(devnull, 0);
    ::execvp(args[0], args.data());
    ::_exit(127);
  }
  return pid;
}

std::optional<int> collect(pid_t pid, bool wait) {
  int status = 0;
  pid_t done;
  while ((done = ::waitpid(pid, &status, wait ? 0 : WNOHANG)) < 0 && errno == EINTR) {
  }
  if (done == 0) return std::nullopt;
  if (done < 0) return 127;  // not a child of this process (any more)
  return statusOf(status);
}

}  // namespace vtc::process
