#include "sources/monitor.h"

#include <unistd.h>

#include <chrono>
#include <vector>

#include "platform/diagnostic_log.h"
#include "platform/event_loop.h"
#include "sources/audit_pipe.h"
#include "sources/event_listener.h"
#include "sources/ssh_journal.h"

namespace tarvod {
namespace {

double MonotonicSeconds() {
  return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

}  // namespace
namespace {

constexpr const char* kInputQueueLabel = "com.quenta.tarvod.inputq";

}  // namespace

std::optional<IdSet> ParseFilterList(std::optional<std::string_view> text) {
  if (!text || text->empty()) return std::nullopt;
  IdSet ids;
  size_t start = 0;
  for (;;) {
    const size_t comma = text->find(',', start);
    ids.insert(plist::LeadingInteger(text->substr(start, comma - start)));
    if (comma == std::string_view::npos) break;
    start = comma + 1;
  }
  return ids;
}

Monitor::Monitor(MonitorHooks hooks)
    : mHooks(std::move(hooks)), mEventSocketPath(kDefaultEventSocketPath) {}

Monitor::~Monitor() {
  if (!mInputEvtQ) return;
  // Sources live on the input queue's thread and are destroyed there, before the queue.
  mInputEvtQ->sync([this] {
    mXPCEventConnection.reset();
    mBSMReadSource.reset();
    mPeers.reset();
    mSshJournal.reset();
    mProgressSource.reset();
  });
  mInputEvtQ.reset();
}

void Monitor::setEventFilterUID(std::optional<IdSet> uids, std::optional<IdSet> gids) {
  mAllowedUIDs = std::move(uids);
  mAllowedGIDs = std::move(gids);
}

bool Monitor::filterBySourceUID(uint32_t uid, uint32_t gid) const {
  if (!mAllowedUIDs && !mAllowedGIDs) return true;
  // The IDs are unsigned: a negative list entry never matches.
  if (mAllowedUIDs && mAllowedUIDs->contains(int64_t{uid})) return true;
  if (mAllowedGIDs && mAllowedGIDs->contains(int64_t{gid})) return true;
  LogMessage(2, "Blocked event because user with ID %u is not in the allowed UID list", uid);
  return false;
}

void Monitor::processEvent(plist::Dictionary event, EventSource source) {
  if (DebugLevel() >= 3) LogMessage(3, "Event received: %s ", plist::Describe(event).c_str());
  countEvent(source);
  if (mHooks.dispatch) mHooks.dispatch(std::move(event));
}

int Monitor::SetXPCListenerFor(EventLoop& queue) {
  int result = -1;
  queue.sync([&] {
    if (!mPeers) mPeers = std::make_unique<PeerConnections>(*this, queue);
    mXPCEventConnection = EventListener::Create(*this, queue, *mPeers, mEventSocketPath);
    result = mXPCEventConnection ? 0 : -1;
  });
  return result;
}

void Monitor::beginListening() {
  if (!mInputEvtQ) mInputEvtQ = std::make_unique<EventLoop>(kInputQueueLabel);
  if (mHooks.progressDescriptor >= 0) {
    mInputEvtQ->sync([this] {
      mProgressSource = mInputEvtQ->addIo(mHooks.progressDescriptor, EPOLLIN, false,
                                          [this](uint32_t) { onBacklogProgress(); });
    });
  }

  LogMessage(1, "Starting the New XPC event listener");
  if (SetXPCListenerFor(*mInputEvtQ) != 0) {
    LogMessage(0, "XPC event listener failed to start up");
  }

  if (mAuthLogSource == "journal") {
    LogMessage(1, "Following sshd in the systemd journal");
    mInputEvtQ->sync([&] {
      Result<std::unique_ptr<SshJournalSource>> source =
          SshJournalSource::Start(*this, *mInputEvtQ, mJournalCursorPath);
      if (source.ok()) {
        mSshJournal = std::move(source.value());
      } else {
        LogMessage(0, "Failed to follow the systemd journal for SSH logins: %s errno = %d",
                   source.status().what().c_str(), source.status().error());
      }
    });
    return;
  }
  if (mAuthLogSource != "auditpipe") return;
  LogMessage(1, "Opening the BSM Auditpipe");
  int descriptor = -1;
  uint64_t bufferSize = 0;
  const int error = OpenAuditPipe(&descriptor, &bufferSize);
  if (error != 0) {
    LogMessage(0, "Failed to open the Auditpipe error = %d", error);
    return;
  }
  mAuditpipe = descriptor;
  mEventBufferSize = bufferSize;
  LogMessage(1, "Starting the Auditpipe listener");
  mInputEvtQ->sync([&] {
    std::unique_ptr<AuditReadSource> source;
    if (StartAuditPipeSource(mAuditpipe, mEventBufferSize, *this, *mInputEvtQ, &source) == 0) {
      mBSMReadSource = std::move(source);
    }
  });
}

void Monitor::stopListening() {
  if (!mInputEvtQ) return;
  mInputEvtQ->sync([this] {
    mXPCEventConnection.reset();
    mPeers.reset();
    mBSMReadSource.reset();  // closes the pipe
    mSshJournal.reset();     // saves the journal cursor
  });
  // Every event already read on the input queue has been dispatched once this returns.
  mInputEvtQ->sync([] {});
  mAuditpipe = -1;
  mEventBufferSize = 0;
}

void Monitor::suspend() {
  if (!mInputEvtQ) return;
  mInputEvtQ->sync([this] {
    if (mXPCEventConnection) mXPCEventConnection->suspend();
  });
}

void Monitor::resume() {
  if (!mInputEvtQ) return;
  mInputEvtQ->sync([this] {
    if (mXPCEventConnection) mXPCEventConnection->resume();
  });
}

void Monitor::applyBackPressure() {
  if (!mHooks.backlog || !mProgressSource || !mInputEvtQ->isCurrentThread()) return;
  if (!mInputEvtQ->readGateOpen() || mHooks.backlog() <= kBackPressureHighJobs) return;
  mInputEvtQ->setReadGateOpen(false);
  mPauses.fetch_add(1, std::memory_order_relaxed);
  mPausedSince.store(MonotonicSeconds(), std::memory_order_relaxed);
  mHooks.signalWhenBacklogAtMost(kBackPressureLowJobs);
}

Monitor::BackPressure Monitor::backPressure() const {
  BackPressure result{mPauses.load(std::memory_order_relaxed),
                      mPausedSeconds.load(std::memory_order_relaxed)};
  if (const double since = mPausedSince.load(std::memory_order_relaxed); since > 0) {
    result.seconds += MonotonicSeconds() - since;
  }
  return result;
}

void Monitor::onBacklogProgress() {
  uint64_t count = 0;
  [[maybe_unused]] ssize_t n = read(mHooks.progressDescriptor, &count, sizeof count);
  if (mInputEvtQ->readGateOpen()) return;
  if (mHooks.backlog() <= kBackPressureLowJobs) {
    mInputEvtQ->setReadGateOpen(true);
    const double since = mPausedSince.exchange(0, std::memory_order_relaxed);
    if (since > 0) {
      mPausedSeconds.store(
          mPausedSeconds.load(std::memory_order_relaxed) + MonotonicSeconds() - since,
          std::memory_order_relaxed);
    }
  } else {
    mHooks.signalWhenBacklogAtMost(kBackPressureLowJobs);
  }
}

int Monitor::runAuditpipeListener() {
  if (mAuditpipe < 0) {
    LogMessage(3, "BSM listener failure errno = %d", EBADF);
    return -1;
  }
  std::vector<uint8_t> record;
  for (;;) {
    const int error = ReadAuditRecord(mAuditpipe, &record);
    if (error != 0) {
      LogMessage(3, "BSM read record failed errno = %d", error);
      return error;
    }
    LogMessage(3, "BSM Audit event received");
    ConvertAuditRecord(record, *this);
  }
}

}  // namespace tarvod
