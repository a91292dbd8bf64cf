#include "sources/ssh_journal.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include "platform/diagnostic_log.h"
#include "platform/event_loop.h"
#include "platform/files.h"
#include "platform/journal_follower.h"
#include "sources/monitor.h"
#include "sources/ssh_log.h"

namespace tarvod {
namespace {

// Entries read per wake-up, so that a burst does not hold the input queue from the sockets.
constexpr size_t kBatch = 64;
// A cursor is a few hundred bytes; anything longer is not ours.
constexpr size_t kMaxCursorBytes = 4096;

}  // namespace

SshJournalSource::SshJournalSource(Monitor& monitor, std::string cursorPath)
    : mMonitor(monitor), mCursorPath(std::move(cursorPath)) {}

Result<std::unique_ptr<SshJournalSource>> SshJournalSource::Start(Monitor& monitor,
                                                                  EventLoop& queue,
                                                                  std::string cursorPath) {
  std::unique_ptr<SshJournalSource> source(new SshJournalSource(monitor, std::move(cursorPath)));
  if (!source->mCursorPath.empty()) {
    Result<std::string> saved = Files::Real().readOwnedFile(source->mCursorPath);
    if (saved.ok() && saved.value().size() <= kMaxCursorBytes) {
      source->mCursor = source->mSavedCursor = saved.value();
    }
  }
  Result<std::unique_ptr<JournalFollower>> journal =
      JournalFollower::Open({"sshd", "sshd-session"}, source->mCursor);
  if (!journal.ok()) return journal.status();
  source->mJournal = std::move(journal.value());
  source->mMoreFd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  SshJournalSource* self = source.get();
  source->mJournalSource = queue.addIo(source->mJournal->descriptor(), EPOLLIN, true,
                                       [self](uint32_t) { self->readEntries(); });
  source->mMoreSource = queue.addIo(source->mMoreFd, EPOLLIN, true, [self](uint32_t) {
    uint64_t count = 0;
    [[maybe_unused]] ssize_t n = read(self->mMoreFd, &count, sizeof count);
    self->readEntries();
  });
  if (!source->mJournalSource || !source->mMoreSource) {
    return Status::Error(ENOMEM, "no event source for the journal");
  }
  // Entries written between the open and now are picked up at once.
  self->readEntries();
  return source;
}

SshJournalSource::~SshJournalSource() {
  mJournalSource.reset();
  mMoreSource.reset();
  if (mMoreFd >= 0) close(mMoreFd);
  saveCursor();
}

void SshJournalSource::readEntries() {
  const std::vector<JournalEntry> entries = mJournal->readNew(kBatch);
  for (const JournalEntry& entry : entries) {
    if (!entry.cursor.empty()) mCursor = entry.cursor;
    if (std::optional<SshLogin> login = ParseSshLogLine(entry.message)) {
      mMonitor.processEvent(SshLoginEvent(*login, entry.message, entry.timestamp),
                            Monitor::EventSource::kSshLogins);
      mMonitor.applyBackPressure();
    }
  }
  if (entries.size() == kBatch) {
    const uint64_t one = 1;
    [[maybe_unused]] ssize_t n = write(mMoreFd, &one, sizeof one);
  }
  saveCursor();
}

void SshJournalSource::saveCursor() {
  if (mCursorPath.empty() || mCursor == mSavedCursor) return;
  const Status status = Files::Real().writeAtomically(mCursorPath, mCursor);
  if (!status.ok()) {
    LogMessage(1, "Failed to save the journal cursor in %s errno = %d", mCursorPath.c_str(),
               status.error());
    return;
  }
  mSavedCursor = mCursor;
}

}  // namespace tarvod
