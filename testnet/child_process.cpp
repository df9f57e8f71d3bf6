#include "child_process.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>

namespace zark::test {
namespace {

using zark::portmap::UniqueFd;
using Clock = std::chrono::steady_clock;

constexpr std::size_t kMaxErrors = 4096;

struct Pipe {
  UniqueFd read;
  UniqueFd write;
};

bool MakePipe(Pipe &pipe) {
  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) {
    ZARK_PM_LOG_CALL("pipe2", -1, errno);
    return false;
  }
  pipe.read.Reset(fds[0]);
  pipe.write.Reset(fds[1]);
  return true;
}

// In the child, between fork and execve: only async-signal-safe calls.
// execve's errno goes to report (closed on a successful execve).
[[noreturn]] void ExecChild(const char *program, char *const argv[],
                            char *const envp[], int devNull, int out, int err,
                            int report, std::size_t maxFileSize) {
  if (::dup2(devNull, STDIN_FILENO) < 0 || ::dup2(out, STDOUT_FILENO) < 0 ||
      ::dup2(err, STDERR_FILENO) < 0) {
    ::_exit(126);
  }
  // Everything else the library or its host had open stays behind.
  if (report < 3 || (report > 3 && ::dup2(report, 3) < 0)) {
    ::_exit(126);
  }
  ::fcntl(3, F_SETFD, FD_CLOEXEC);
  ::close_range(4, UINT_MAX, 0);
  if (maxFileSize > 0) {
    rlimit limit{maxFileSize, maxFileSize};
    if (::setrlimit(RLIMIT_FSIZE, &limit) != 0) {
      ::_exit(126);
    }
  }
  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  ::signal(SIGPIPE, SIG_DFL);
  ::signal(SIGXFSZ, SIG_DFL);
  ::execve(program, argv, envp);
  int saved = errno;
  (void)!::write(3, &saved, sizeof(saved));
  ::_exit(127);
}

} // namespace

ChildResult RunProgram(const std::string &program,
                       const std::vector<std::string> &args,
                       const ChildOptions &options) {
  ChildResult result;
  // Everything execve needs is built before fork: the child may not
  // allocate.
  std::vector<char *> argv;
  argv.reserve(args.size() + 1);
  for (const std::string &arg : args) {
    argv.push_back(const_cast<char *>(arg.c_str()));
  }
  argv.push_back(nullptr);
  static char path[] = "PATH=/usr/sbin:/usr/bin:/sbin:/bin";
  static char locale[] = "LC_ALL=C";
  // Made before the fork: the child does nothing but set up descriptors
  // and execute.
  // cppcheck-suppress variableScope
  char *envp[] = {path, locale, nullptr};

  UniqueFd devNull(::open("/dev/null", O_RDWR | O_CLOEXEC));
  if (!devNull.Valid()) {
    ZARK_PM_LOG_CALL("open", -1, errno, "/dev/null");
    return result;
  }
  Pipe out;
  Pipe err;
  Pipe report;
  if (!MakePipe(out) || !MakePipe(err) || !MakePipe(report)) {
    return result;
  }
  pid_t pid = ::fork();
  if (pid < 0) {
    ZARK_PM_LOG_CALL("fork", pid, errno, program.c_str());
    return result;
  }
  if (pid == 0) {
    ExecChild(program.c_str(), argv.data(), envp, devNull.Get(),
              out.write.Get(), err.write.Get(), report.write.Get(),
              options.maxFileSize);
  }
  out.write.Reset();
  err.write.Reset();
  report.write.Reset();
  devNull.Reset();
  // The report pipe closes without a word when execve works; otherwise it
  // carries execve's errno. Either comes at once.
  int execErrno = 0;
  ssize_t reported = 0;
  do {
    reported = ::read(report.read.Get(), &execErrno, sizeof(execErrno));
  } while (reported < 0 && errno == EINTR);
  result.started = reported == 0;
  if (!result.started) {
    ZARK_PM_LOG_CALL("execve", -1, reported > 0 ? execErrno : errno,
                     program.c_str());
  }

  const Clock::time_point deadline = Clock::now() + options.timeout;
  bool killed = false;
  auto kill = [&] {
    if (!killed) {
      ::kill(pid, SIGKILL);
      killed = true;
    }
  };
  // Read both pipes until the program closes them (ends) or is cut short.
  while (out.read.Valid() || err.read.Valid()) {
    pollfd fds[2] = {{out.read.Get(), POLLIN, 0}, {err.read.Get(), POLLIN, 0}};
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - Clock::now());
    if (left.count() <= 0) {
      result.timedOut = true;
      kill();
      break;
    }
    int ready = ::poll(
        fds, 2, static_cast<int>(std::min<long long>(left.count(), INT_MAX)));
    if (ready < 0) {
      if (errno == EINTR) {
        continue;
      }
      ZARK_PM_LOG_CALL("poll", ready, errno, program.c_str());
      kill();
      break;
    }
    for (int i = 0; i < 2; ++i) {
      if (fds[i].fd < 0 || fds[i].revents == 0) {
        continue;
      }
      char buffer[16384];
      ssize_t got = ::read(fds[i].fd, buffer, sizeof(buffer));
      if (got < 0 && errno == EINTR) {
        continue;
      }
      if (got <= 0) {
        (i == 0 ? out.read : err.read).Reset();
        continue;
      }
      if (i == 0) {
        if (result.output.size() + static_cast<std::size_t>(got) >
            options.maxOutput) {
          result.outputTooLarge = true;
          kill();
          out.read.Reset();
          err.read.Reset();
          break;
        }
        result.output.append(buffer, static_cast<std::size_t>(got));
      } else if (result.errors.size() < kMaxErrors) {
        result.errors.append(buffer,
                             std::min(static_cast<std::size_t>(got),
                                      kMaxErrors - result.errors.size()));
      }
    }
  }
  // The program has closed its output or was killed: reaping it is bounded
  // either way, but a program that closed its output and keeps running is
  // still held to the deadline.
  int status = 0;
  for (;;) {
    pid_t done = ::waitpid(pid, &status, killed ? 0 : WNOHANG);
    if (done == pid) {
      break;
    }
    if (done < 0 && errno != EINTR) {
      ZARK_PM_LOG_CALL("waitpid", done, errno, program.c_str());
      return result;
    }
    if (done == 0) {
      if (Clock::now() >= deadline) {
        result.timedOut = true;
        kill();
      } else {
        ::usleep(1000);
      }
    }
  }
  if (WIFEXITED(status)) {
    result.exited = true;
    result.exitStatus = WEXITSTATUS(status);
  }
  return result;
}

} // namespace zark::test
