// One runcommand action running /bin/true, in process: commands per second and the cost of
// one command, beside plain fork+exec and posix_spawn of the same program in the same run.
#include <benchmark/benchmark.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include "actions/run_command_action.h"
#include "platform/process_launcher.h"

extern char** environ;

namespace tarvod {
namespace {

constexpr const char* kProgram = "/bin/true";

void BM_RunCommandAction(benchmark::State& state) {
  RunCommandAction handler(ProcessLauncher::Real());
  Context context(std::make_shared<VariableStore>(), std::make_shared<Rulebase>(),
                  plist::Dictionary{{"eventType", "bench"}});
  const plist::Dictionary rule{{"filePath", "/rules/bench.plist"}};
  const plist::Dictionary action{{"type", "runcommand"}, {"command", kProgram}};
  const FiredRule fired{rule, "bench", "/rules/bench.plist"};
  for (auto _ : state) handler.perform(action, fired, context);
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_RunCommandAction)->UseRealTime();

void BM_ForkExec(benchmark::State& state) {
  char* const argv[] = {const_cast<char*>(kProgram), nullptr};
  for (auto _ : state) {
    const pid_t pid = fork();
    if (pid == 0) {
      execve(kProgram, argv, environ);
      _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ForkExec)->UseRealTime();

void BM_PosixSpawn(benchmark::State& state) {
  char* const argv[] = {const_cast<char*>(kProgram), nullptr};
  for (auto _ : state) {
    pid_t pid = -1;
    if (posix_spawn(&pid, kProgram, nullptr, nullptr, argv, environ) != 0) {
      state.SkipWithError("posix_spawn failed");
      break;
    }
    int status = 0;
    waitpid(pid, &status, 0);
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_PosixSpawn)->UseRealTime();

}  // namespace
}  // namespace tarvod
