// Starting programs in child processes of a threaded daemon, and waiting for them. Any thread
// may call; launch and the waits block only the caller.
//
// The caller prepares everything the child needs (vectors, group list, message texts) in a
// LaunchRequest. The child shares the daemon's memory until it executes the program and runs
// only async-signal-safe calls: another thread may hold the log lock or a directory-service
// lock at that instant, and anything that takes one would deadlock the child.
#pragma once

#include <sys/types.h>

#include <array>
#include <optional>
#include <string>
#include <vector>

#include "platform/status.h"

namespace tarvod {

// A line the child writes to the error log when one of its steps fails: text, then the
// step's error number when withError is set, then a newline.
struct ChildMessage {
  std::string text;
  bool withError = false;
};

// Where one of the standard streams comes from: a descriptor of the caller (a pipe end),
// duplicated onto the stream, or else a path opened with flags and mode after the identity
// change, with the rights of the identity asked for.
struct Redirection {
  int descriptor = -1;
  std::string path = "/dev/null";
  int flags = 0;  // O_RDONLY
  mode_t mode = 0;
  ChildMessage failure;
};

// The identity the program runs with: real, effective and saved IDs, and the supplementary
// groups exactly as listed.
struct Identity {
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;
};

struct LaunchRequest {
  std::string program;                 // the path given to execve; no search of a path list
  std::vector<std::string> arguments;  // the whole vector, element 0 included
  // "name=value" strings; nullopt: the daemon's own environment.
  std::optional<std::vector<std::string>> environment;
  // nullopt: the daemon's own identity. A change that fails ends the child with status 1 and
  // identityFailure when the daemon runs as root; otherwise failures are ignored and the
  // program runs as the daemon's own (unprivileged) user.
  std::optional<Identity> identity;
  ChildMessage identityFailure;
  std::array<Redirection, 3> redirections;  // standard input, output and error
  std::string workingDirectory;             // empty: the daemon's own
  // Written when entering workingDirectory fails, which then ends the child with the error
  // number as status; an empty text means the failure is ignored.
  ChildMessage chdirFailure;
  // Written when executing program fails; the child then ends with the error number.
  ChildMessage execFailure;
  // When set, standard input is a new pipe in place of redirections[0]: launch writes this
  // text to it and closes it before it returns, spending at most inputSeconds on the writing
  // (0: no limit). A program that ends or closes its input early leaves the rest unwritten.
  std::optional<std::string> input;
  double inputSeconds = 0;
};

// A started child. The pidfd is the caller's until a wait reports the child's end or
// terminate returns; both reap the child and close it.
struct ChildProcess {
  pid_t pid = -1;
  int pidfd = -1;
  // How the writing of LaunchRequest::input went: EPIPE when the program closed its input
  // early, ETIMEDOUT when inputSeconds passed first; inputWritten bytes reached the pipe.
  Status input = Status::Ok();
  size_t inputWritten = 0;
};

// The status of an ended child: its exit status, or 128 + the signal that ended it.
using ExitStatus = int;

class ProcessLauncher {
 public:
  virtual ~ProcessLauncher() = default;

  // Starts the child in a process group of its own and returns once it has executed the
  // program or ended, and has taken its input when one is given (within the input's time
  // limit; the writing never raises SIGPIPE). Before the program runs, the child: resets every
  // signal to its default action with none blocked; changes identity; takes descriptor
  // redirections; closes every descriptor from 3 up; opens path redirections; enters the working
  // directory. A step that fails ends it: status 1 (identity, redirection), the error number
  // (working directory, execution). Fails only when no child (or no input pipe) could be created.
  virtual Result<ChildProcess> launch(const LaunchRequest& request) = 0;
  // Waits for the child's end, at most seconds when given. nullopt: it still runs.
  virtual std::optional<ExitStatus> wait(ChildProcess& child, std::optional<double> seconds) = 0;
  // Ends the child's process group: SIGTERM, then SIGKILL to whatever is left of the group
  // once the child has ended or graceSeconds have passed, whichever comes first. Reaps it.
  virtual ExitStatus terminate(ChildProcess& child, double graceSeconds) = 0;

  // The host's processes; lives as long as the process.
  static ProcessLauncher& Real();
};

// How long a program that outlived its limit gets between SIGTERM and SIGKILL.
inline constexpr double kTerminationGraceSeconds = 2.0;

// Waits for child for at most wait seconds (none: without limit). A child still running then
// is reported at level 0 as "CALLER: PROGRAM still running after LIMIT seconds; ..." and its
// process group ended. Returns the child's status.
ExitStatus WaitOrEnd(ProcessLauncher& launcher, ChildProcess& child, std::optional<double> wait,
                     const char* caller, const std::string& program, double limit);

}  // namespace tarvod
