#include "platform/process_launcher.h"

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <memory>

#include "platform/diagnostic_log.h"

extern char** environ;

namespace tarvod {
namespace {

// The child runs on a stack of its own while it shares the daemon's memory; 64 KiB holds the
// child's few frames and one message line with a wide margin.
constexpr size_t kChildStackBytes = 64 * 1024;
// Room kept after a message text for the error number and the newline.
constexpr size_t kErrorNumberRoom = 16;
// When close_range is missing, the sweep closes up to the open-files limit, at most this.
constexpr unsigned kMaxSweptDescriptor = 65536;
constexpr idtype_t kPidfdIdType = static_cast<idtype_t>(3);  // P_PIDFD

// Code that runs in the child is not instrumented: a sanitizer's bookkeeping would write the
// daemon's memory (shared until the program runs) from a process the daemon does not know.
#define TARVOD_CHILD_CODE __attribute__((no_sanitize("address", "undefined", "thread")))

struct MessageText {
  const char* text = nullptr;  // nullptr: nothing is written
  size_t length = 0;
  bool withError = false;
};

struct ChildRedirection {
  int descriptor;
  const char* path;
  int flags;
  mode_t mode;
  MessageText failure;
};

// Everything the child reads, prepared by the parent; the parent's frame owns the memory
// these pointers reach, and it stays put until the child has executed the program or ended.
struct ChildPlan {
  const char* program;
  char* const* argv;
  char* const* envp;
  bool changeIdentity;
  bool identityRequired;
  uid_t uid;
  gid_t gid;
  const gid_t* groups;
  size_t groupCount;
  MessageText identityFailure;
  ChildRedirection redirections[3];
  const char* workingDirectory;  // nullptr: stay
  MessageText chdirFailure;
  MessageText execFailure;
  int logFd;  // a close-on-exec duplicate of the error log; -1 without one
};

MessageText TextOf(const ChildMessage& message) {
  if (message.text.empty()) return {};
  const size_t limit = kMaxLogMessageBytes - kErrorNumberRoom;
  return MessageText{message.text.c_str(), std::min(message.text.size(), limit), message.withError};
}

TARVOD_CHILD_CODE void WriteChildMessage(int logFd, const MessageText& message, int error) {
  if (logFd < 0 || message.text == nullptr) return;
  char line[kMaxLogMessageBytes + 1];
  size_t length = message.length;
  __builtin_memcpy(line, message.text, length);
  if (message.withError) {
    char digits[kErrorNumberRoom];
    size_t count = 0;
    unsigned value = error < 0 ? 0u : static_cast<unsigned>(error);
    do {
      digits[count++] = static_cast<char>('0' + value % 10);
      value /= 10;
    } while (value != 0 && count < sizeof digits);
    while (count > 0) line[length++] = digits[--count];
  }
  line[length++] = '\n';
  // One write: the daemon's threads append to the same file meanwhile.
  while (write(logFd, line, length) < 0 && errno == EINTR) {
  }
}

[[noreturn]] TARVOD_CHILD_CODE void FailChild(const ChildPlan& plan, const MessageText& message,
                                              int error, int status) {
  WriteChildMessage(plan.logFd, message, error);
  _exit(status);
}

// Closes every descriptor from 3 up except the log's.
TARVOD_CHILD_CODE void SweepDescriptors(int logFd) {
  const unsigned keep = logFd >= 3 ? static_cast<unsigned>(logFd) : 0;
  bool swept = true;
  if (keep > 3 && close_range(3, keep - 1, 0) != 0) swept = false;
  if (swept && close_range(keep >= 3 ? keep + 1 : 3, ~0U, 0) == 0) return;
  // A kernel without close_range: every number up to the open-files limit, bounded.
  struct rlimit limit {};
  unsigned last = 1024;
  if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
    last = limit.rlim_cur < kMaxSweptDescriptor ? static_cast<unsigned>(limit.rlim_cur)
                                                : kMaxSweptDescriptor;
  }
  for (unsigned fd = 3; fd < last; ++fd) {
    if (fd != keep) close(static_cast<int>(fd));
  }
}

TARVOD_CHILD_CODE int ChildMain(void* argument) {
  const ChildPlan& plan = *static_cast<const ChildPlan*>(argument);

  // The daemon's handlers would run on its memory: back to default actions, then unblock
  // what the parent blocked around the start.
  struct sigaction defaultAction {};
  defaultAction.sa_handler = SIG_DFL;
  sigemptyset(&defaultAction.sa_mask);
  for (int sig = 1; sig < NSIG; ++sig) {
    struct sigaction current {};
    if (sigaction(sig, nullptr, &current) == 0 && current.sa_handler != SIG_DFL) {
      sigaction(sig, &defaultAction, nullptr);
    }
  }
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  // A group of its own, so that a time limit ends the program with everything it started.
  setpgid(0, 0);

  // Raw system calls: the library's wrappers apply an identity change to every thread of the
  // process and would signal the daemon's threads from here.
  if (plan.changeIdentity) {
    if (syscall(SYS_setgroups, plan.groupCount, plan.groups) != 0 && plan.identityRequired) {
      FailChild(plan, plan.identityFailure, errno, 1);
    }
    if (syscall(SYS_setresgid, plan.gid, plan.gid, plan.gid) != 0 && plan.identityRequired) {
      FailChild(plan, plan.identityFailure, errno, 1);
    }
    if (syscall(SYS_setresuid, plan.uid, plan.uid, plan.uid) != 0 && plan.identityRequired) {
      FailChild(plan, plan.identityFailure, errno, 1);
    }
  }

  for (int target = 0; target < 3; ++target) {
    const ChildRedirection& redirection = plan.redirections[target];
    if (redirection.descriptor < 0) continue;
    const int result = redirection.descriptor == target ? fcntl(target, F_SETFD, 0)
                                                        : dup2(redirection.descriptor, target);
    if (result < 0) FailChild(plan, redirection.failure, errno, 1);
  }

  SweepDescriptors(plan.logFd);

  for (int target = 0; target < 3; ++target) {
    const ChildRedirection& redirection = plan.redirections[target];
    if (redirection.descriptor >= 0) continue;
    const int fd = open(redirection.path, redirection.flags | O_CLOEXEC, redirection.mode);
    if (fd < 0) FailChild(plan, redirection.failure, errno, 1);
    if (fd == target) {
      if (fcntl(fd, F_SETFD, 0) < 0) FailChild(plan, redirection.failure, errno, 1);
      continue;
    }
    if (dup2(fd, target) < 0) FailChild(plan, redirection.failure, errno, 1);
    if (close(fd) != 0) FailChild(plan, redirection.failure, errno, 1);
  }

  if (plan.workingDirectory != nullptr && chdir(plan.workingDirectory) != 0 &&
      plan.chdirFailure.text != nullptr) {
    const int error = errno;
    FailChild(plan, plan.chdirFailure, error, error);
  }

  execve(plan.program, plan.argv, plan.envp);
  const int error = errno;
  FailChild(plan, plan.execFailure, error, error);
}

// The child's status once it has ended; reaps it and closes its pidfd.
ExitStatus Reap(ChildProcess& child) {
  siginfo_t info{};
  int result;
  do {
    result = waitid(kPidfdIdType, static_cast<id_t>(child.pidfd), &info, WEXITED);
  } while (result != 0 && errno == EINTR);
  close(child.pidfd);
  child.pidfd = -1;
  if (result != 0) return -1;
  return info.si_code == CLD_EXITED ? info.si_status : 128 + info.si_status;
}

// Waits until the child has ended, without reaping it; false when seconds passed first.
// Signals to the daemon interrupt the poll; it resumes with the time that is left.
bool AwaitEnd(const ChildProcess& child, double seconds) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = Clock::now() + std::chrono::duration<double>(seconds);
  for (;;) {
    const std::chrono::duration<double, std::milli> left = deadline - Clock::now();
    // Long limits are waited for an hour at a time: poll takes an int of milliseconds.
    const int milliseconds =
        left.count() <= 0 ? 0 : static_cast<int>(std::ceil(std::min(left.count(), 3.6e6)));
    struct pollfd entry {
      child.pidfd, POLLIN, 0
    };
    const int ready = poll(&entry, 1, milliseconds);
    if (ready > 0) return true;
    if (ready < 0 && errno != EINTR) return true;  // the reap that follows reports what it can
    if (ready == 0 && milliseconds == 0) return false;
  }
}

// Writes input to the pipe's write end and closes it, giving up after seconds (0: never).
// SIGPIPE is held back on this thread while it writes, and one it raised is taken before the
// mask is restored, so a program that closes its input early cannot end the daemon even where
// the signal is not ignored: the write then fails with EPIPE.
Status FeedInput(int fd, const std::string& input, double seconds, size_t* written) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = Clock::now() + std::chrono::duration<double>(seconds);
  sigset_t pipeSignal;
  sigset_t previous;
  sigemptyset(&pipeSignal);
  sigaddset(&pipeSignal, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipeSignal, &previous);
  fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
  Status status = Status::Ok();
  *written = 0;
  while (*written < input.size()) {
    const ssize_t count = write(fd, input.data() + *written, input.size() - *written);
    if (count > 0) {
      *written += static_cast<size_t>(count);
      continue;
    }
    if (count < 0 && errno == EINTR) continue;
    if (count < 0 && errno != EAGAIN) {
      status = Status::Error(errno, "write to standard input");
      break;
    }
    int milliseconds = -1;
    if (seconds > 0) {
      const std::chrono::duration<double, std::milli> left = deadline - Clock::now();
      milliseconds =
          left.count() <= 0 ? 0 : static_cast<int>(std::ceil(std::min(left.count(), 3.6e6)));
      if (milliseconds == 0) {
        status = Status::Error(ETIMEDOUT, "write to standard input");
        break;
      }
    }
    struct pollfd entry {
      fd, POLLOUT, 0
    };
    if (poll(&entry, 1, milliseconds) < 0 && errno != EINTR) {
      status = Status::Error(errno, "poll standard input");
      break;
    }
  }
  close(fd);
  const struct timespec now {};
  while (sigtimedwait(&pipeSignal, nullptr, &now) == SIGPIPE) {
  }
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  return status;
}

class RealProcessLauncher final : public ProcessLauncher {
 public:
  Result<ChildProcess> launch(const LaunchRequest& request) override {
    std::vector<char*> argv;
    argv.reserve(request.arguments.size() + 1);
    for (const std::string& argument : request.arguments) {
      argv.push_back(const_cast<char*>(argument.c_str()));
    }
    argv.push_back(nullptr);
    std::vector<char*> envp;
    if (request.environment) {
      envp.reserve(request.environment->size() + 1);
      for (const std::string& entry : *request.environment) {
        envp.push_back(const_cast<char*>(entry.c_str()));
      }
      envp.push_back(nullptr);
    }

    ChildPlan plan{};
    plan.program = request.program.c_str();
    plan.argv = argv.data();
    plan.envp = request.environment ? envp.data() : environ;
    plan.changeIdentity = request.identity.has_value();
    plan.identityRequired = geteuid() == 0;
    if (request.identity) {
      plan.uid = request.identity->uid;
      plan.gid = request.identity->gid;
      plan.groups = request.identity->groups.data();
      plan.groupCount = request.identity->groups.size();
    }
    plan.identityFailure = TextOf(request.identityFailure);
    for (size_t i = 0; i < 3; ++i) {
      const Redirection& from = request.redirections[i];
      plan.redirections[i] = ChildRedirection{from.descriptor, from.path.c_str(), from.flags,
                                              from.mode, TextOf(from.failure)};
    }
    plan.workingDirectory =
        request.workingDirectory.empty() ? nullptr : request.workingDirectory.c_str();
    plan.chdirFailure = TextOf(request.chdirFailure);
    plan.execFailure = TextOf(request.execFailure);
    int inputPipe[2] = {-1, -1};
    if (request.input) {
      if (pipe2(inputPipe, O_CLOEXEC) != 0) return Status::Error(errno, "pipe");
      plan.redirections[0].descriptor = inputPipe[0];
    }
    plan.logFd = DuplicateErrorLog();

    // Kept per thread: the parent waits while the child runs on it, so one is enough.
    thread_local std::unique_ptr<char[]> stack(new char[kChildStackBytes]);
    void* stackTop = stack.get() + kChildStackBytes;

    // No signal handler may run in the child before it has reset them; the mask it inherits
    // is its own once it runs.
    sigset_t all;
    sigset_t previous;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &previous);
    int pidfd = -1;
    const pid_t pid =
        clone(ChildMain, stackTop, CLONE_VM | CLONE_VFORK | CLONE_PIDFD | SIGCHLD, &plan, &pidfd);
    const int error = errno;
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    if (plan.logFd >= 0) close(plan.logFd);
    if (inputPipe[0] >= 0) close(inputPipe[0]);
    if (pid < 0) {
      if (inputPipe[1] >= 0) close(inputPipe[1]);
      return Status::Error(error, "clone");
    }
    ChildProcess child{pid, pidfd};
    if (request.input) {
      child.input =
          FeedInput(inputPipe[1], *request.input, request.inputSeconds, &child.inputWritten);
    }
    return child;
  }

  std::optional<ExitStatus> wait(ChildProcess& child, std::optional<double> seconds) override {
    if (seconds && !AwaitEnd(child, *seconds)) return std::nullopt;
    return Reap(child);
  }

  ExitStatus terminate(ChildProcess& child, double graceSeconds) override {
    // The unreaped child keeps its group's ID from being reused, so the group signals reach
    // only what it started. The leader is signalled directly as well, in case it ended
    // before it made its group.
    Signal(child, SIGTERM);
    AwaitEnd(child, graceSeconds);
    Signal(child, SIGKILL);
    return Reap(child);
  }

 private:
  static void Signal(const ChildProcess& child, int sig) {
    kill(-child.pid, sig);
    syscall(SYS_pidfd_send_signal, child.pidfd, sig, nullptr, 0);
  }
};

}  // namespace

ProcessLauncher& ProcessLauncher::Real() {
  static RealProcessLauncher launcher;
  return launcher;
}

ExitStatus WaitOrEnd(ProcessLauncher& launcher, ChildProcess& child, std::optional<double> wait,
                     const char* caller, const std::string& program, double limit) {
  if (std::optional<ExitStatus> status = launcher.wait(child, wait)) return *status;
  LogMessage(0,
             "%s: %s still running after %g seconds; ending its process group "
             "(SIGTERM, SIGKILL %g seconds later)",
             caller, program.c_str(), limit, kTerminationGraceSeconds);
  return launcher.terminate(child, kTerminationGraceSeconds);
}

}  // namespace tarvod
