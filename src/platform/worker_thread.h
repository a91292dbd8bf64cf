// The daemon's own threads. Each starts with the signals that steer the process (SIGTERM,
// SIGINT, SIGHUP, SIGUSR1) blocked, so the kernel hands them to the main thread, whose loop
// acts on them: a worker's blocking call is never cut short by them.
#pragma once

#include <functional>
#include <thread>

namespace tarvod {

std::thread StartWorkerThread(std::function<void()> body);

}  // namespace tarvod
