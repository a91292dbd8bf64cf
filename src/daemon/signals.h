// Signal requests: SIGTERM and SIGINT request a stop, SIGHUP a reload; SIGUSR1 is caught and
// ignored. Handlers only set flags (and wake the main loop); the main loop takes them.
#pragma once

namespace tarvod {

void InstallSignalHandlers();
// True, clearing the flag, when the request was pending.
bool TakeStopRequest();
bool TakeReloadRequest();
// A descriptor that becomes readable when a signal has set a request (for the main loop).
int SignalWakeDescriptor();
// Empties the wake descriptor after the loop woke on it.
void ClearSignalWake();

}  // namespace tarvod
