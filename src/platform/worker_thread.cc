#include "platform/worker_thread.h"

#include <pthread.h>
#include <signal.h>

#include <utility>

namespace tarvod {

std::thread StartWorkerThread(std::function<void()> body) {
  sigset_t steering;
  sigemptyset(&steering);
  for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGUSR1}) sigaddset(&steering, signal);
  // A new thread takes its creator's mask: blocked around the creation only.
  sigset_t previous;
  pthread_sigmask(SIG_BLOCK, &steering, &previous);
  std::thread thread(std::move(body));
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  return thread;
}

}  // namespace tarvod
