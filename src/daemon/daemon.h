// The daemon's main: command line, configuration, start of every part, the main loop in
// 5-second slices, and the orderly stop. Main thread.
#pragma once

namespace tarvod {

// Returns the process exit status: 255 for a usage error or logs that cannot be opened,
// 0 when no rules were found and after a normal stop.
int DaemonMain(int argc, char** argv);

}  // namespace tarvod
