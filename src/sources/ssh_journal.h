// The SSH login source on Linux: sshd's lines in the systemd journal, followed on the input
// queue, become "auth.success" and "auth.failure" events. Only entries whose _COMM is sshd or
// sshd-session and whose _UID is 0 are read: journald sets both itself, so no other user can
// forge a login by writing the same text. Everything here runs on the input queue's thread.
#pragma once

#include <memory>
#include <string>

#include "platform/status.h"

namespace tarvod {

class EventLoop;
class IoSource;
class JournalFollower;
class Monitor;

class SshJournalSource {
 public:
  // Follows the journal from the entry after the cursor saved in cursorPath (from the end on
  // a first start) and hands each login to the monitor. The error when the journal cannot be
  // opened.
  static Result<std::unique_ptr<SshJournalSource>> Start(Monitor& monitor, EventLoop& queue,
                                                         std::string cursorPath);
  // Stops following and saves the cursor of the last entry read.
  ~SshJournalSource();
  SshJournalSource(const SshJournalSource&) = delete;
  SshJournalSource& operator=(const SshJournalSource&) = delete;

 private:
  SshJournalSource(Monitor& monitor, std::string cursorPath);
  void readEntries();
  void saveCursor();

  Monitor& mMonitor;
  const std::string mCursorPath;
  std::unique_ptr<JournalFollower> mJournal;
  std::unique_ptr<IoSource> mJournalSource;
  // Readable while entries are left over from a full batch; gated, so that back-pressure
  // holds them like unread socket packets.
  int mMoreFd = -1;
  std::unique_ptr<IoSource> mMoreSource;
  std::string mCursor;
  std::string mSavedCursor;
};

}  // namespace tarvod
