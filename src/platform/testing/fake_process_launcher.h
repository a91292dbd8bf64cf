// A process launcher for tests of the code that prepares children: it records every request
// and starts nothing. A launch can be made to fail, and a child to outlive every wait.
#pragma once

#include <cerrno>
#include <optional>
#include <vector>

#include "platform/process_launcher.h"

namespace tarvod {

class FakeProcessLauncher final : public ProcessLauncher {
 public:
  std::vector<LaunchRequest> requests;
  std::vector<std::optional<double>> waits;  // the limit of each wait, in order
  int terminations = 0;
  bool failLaunch = false;
  bool runsForever = false;  // every wait with a limit times out
  ExitStatus status = 0;

  Result<ChildProcess> launch(const LaunchRequest& request) override {
    if (failLaunch) return Status::Error(EAGAIN, "clone");
    requests.push_back(request);
    return ChildProcess{static_cast<pid_t>(1000 + requests.size()), -1};
  }
  std::optional<ExitStatus> wait(ChildProcess&, std::optional<double> seconds) override {
    waits.push_back(seconds);
    if (runsForever && seconds) return std::nullopt;
    return status;
  }
  ExitStatus terminate(ChildProcess&, double) override {
    ++terminations;
    return 128 + 9;
  }
};

}  // namespace tarvod
