#include "daemon/signals.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdint>

namespace tarvod {
namespace {

static_assert(std::atomic<int64_t>::is_always_lock_free, "flags must be safe in handlers");
std::atomic<int64_t> gStopRequest{0};
std::atomic<int64_t> gReloadRequest{0};
std::atomic<int64_t> gUserSignal{0};  // consulted by nothing: SIGUSR1 must simply not kill us
int gWakeFd = -1;

void Wake() {
  if (gWakeFd >= 0) {
    const uint64_t one = 1;
    const int savedErrno = errno;
    [[maybe_unused]] ssize_t n = write(gWakeFd, &one, sizeof one);
    errno = savedErrno;
  }
}

void OnStop(int) {
  gStopRequest.store(1);
  Wake();
}
void OnReload(int) {
  gReloadRequest.store(1);
  Wake();
}
void OnUser(int) { gUserSignal.store(1); }

void Install(int signal, void (*handler)(int)) {
  struct sigaction action {};
  action.sa_handler = handler;
  sigemptyset(&action.sa_mask);
  action.sa_flags = 0;  // no SA_RESTART: a blocked call returns so the loop sees the request
  sigaction(signal, &action, nullptr);
}

}  // namespace

void InstallSignalHandlers() {
  gStopRequest.store(0);
  gReloadRequest.store(0);
  gUserSignal.store(0);
  if (gWakeFd < 0) gWakeFd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  Install(SIGTERM, OnStop);
  Install(SIGINT, OnStop);
  Install(SIGHUP, OnReload);
  Install(SIGUSR1, OnUser);
  // A mail program that closes its input early must not end the daemon: the write fails with
  // EPIPE instead.
  Install(SIGPIPE, SIG_IGN);
}

bool TakeStopRequest() { return gStopRequest.exchange(0) == 1; }
bool TakeReloadRequest() { return gReloadRequest.exchange(0) == 1; }
int SignalWakeDescriptor() { return gWakeFd; }

void ClearSignalWake() {
  uint64_t value = 0;
  [[maybe_unused]] ssize_t n = read(gWakeFd, &value, sizeof value);
}

}  // namespace tarvod
