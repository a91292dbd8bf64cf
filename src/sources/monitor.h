// The Monitor: the one object through which events from outside the daemon enter the rule
// engine. It owns the input queue (a thread running its own event loop) on which the event
// socket and the audit pipe deliver, and the sender filter.
// Main thread: the constructor, setEventSocketPath, setEventFilterUID, beginListening,
// stopListening, suspend, resume, processNotification, periodicEvent. Input queue:
// filterBySourceUID, applyBackPressure. Any thread: processEvent.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "plist/value.h"

namespace tarvod {

class EventLoop;
class EventListener;
class IoSource;
class PeerConnections;
class SshJournalSource;
class AuditReadSource;
struct Notification;

using IdSet = std::set<int64_t>;

// A filterByUID / filterByGID text: the set of its comma-separated numbers, each read as a
// property-list string is read as an integer (no digits: 0); nullopt for an absent or empty
// text. A lone comma therefore gives { 0 }.
std::optional<IdSet> ParseFilterList(std::optional<std::string_view> text);

// What the Monitor hands events to, and how it watches the rule engine's backlog. Tests
// replace them; EngineHooks (monitor_engine.h) wires them to an Engine.
struct MonitorHooks {
  // Takes the event over: the engine keeps it without a copy.
  std::function<void(plist::Dictionary&&)> dispatch;
  // Jobs waiting on the processing queue; empty: no back-pressure.
  std::function<size_t()> backlog;
  // Asks for progressDescriptor to become readable once at most the given number of jobs
  // wait. With backlog, both must be set.
  std::function<void(size_t)> signalWhenBacklogAtMost;
  int progressDescriptor = -1;
};

// While more jobs than kBackPressureHighJobs wait on the processing queue, the input queue
// reads no socket and no audit record; it reads again once at most kBackPressureLowJobs
// wait. Senders meanwhile wait in the kernel's socket buffers: nothing is dropped, and the
// events waiting inside the daemon (one job each) stay below about kBackPressureHighJobs.
// A shorter queue is also a faster one: the events waiting stay in the processor's caches.
inline constexpr size_t kBackPressureHighJobs = 1024;
inline constexpr size_t kBackPressureLowJobs = 256;

// So that no local user can take every connection to the event socket: a connection that
// sends nothing for this many seconds is closed, and each user but root may hold this many
// connections at once.
inline constexpr int64_t kDefaultConnectionIdleTimeout = 60;
inline constexpr int64_t kDefaultMaxConnectionsPerUID = 32;

class Monitor {
 public:
  explicit Monitor(MonitorHooks hooks);
  // Stops every source and the input queue.
  ~Monitor();
  Monitor(const Monitor&) = delete;
  Monitor& operator=(const Monitor&) = delete;

  // Where SSH logins come from (configuration key authLogSource): "journal" (sshd's lines in
  // the systemd journal, resumed from the cursor saved at journalCursorPath), "auditpipe"
  // (the BSM audit pipe) or "none". Set before beginListening; the default is "auditpipe".
  void setAuthLogSource(std::string kind, std::string journalCursorPath) {
    mAuthLogSource = std::move(kind);
    mJournalCursorPath = std::move(journalCursorPath);
  }

  // The event socket's path (configuration key eventSocketPath); set before beginListening.
  void setEventSocketPath(std::string path) { mEventSocketPath = std::move(path); }
  const std::string& eventSocketPath() const { return mEventSocketPath; }
  // Seconds a connection may stay silent before it is closed (connectionIdleTimeout), and
  // connections one user other than root may hold (maxConnectionsPerUID); 0 or less: no
  // limit. Set before beginListening.
  void setConnectionIdleTimeout(int64_t seconds) { mConnectionIdleTimeout = seconds; }
  int64_t connectionIdleTimeout() const { return mConnectionIdleTimeout; }
  void setMaxConnectionsPerUID(int64_t count) { mMaxConnectionsPerUID = count; }
  int64_t maxConnectionsPerUID() const { return mMaxConnectionsPerUID; }

  // Starts the event socket listener on queue: 0, or -1 when it cannot be created.
  int SetXPCListenerFor(EventLoop& queue);
  // A blocking reader of mAuditpipe that the daemon does not use; returns the error number
  // that ended it, or -1 when it could not start.
  int runAuditpipeListener();
  // Where events come from, as `tarvodctl stats` counts them.
  enum class EventSource { kSocket, kSshLogins, kNotifications, kPeriodic, kCount };
  void processEvent(plist::Dictionary event, EventSource source = EventSource::kSocket);
  // A notification observed for an event type (notifications.cc): its user information is
  // the event, an absent one an empty event.
  void processNotification(const Notification& notification);
  // A periodic timer fired (periodic_events.cc).
  void periodicEvent(const plist::Dictionary& event);
  bool filterBySourceUID(uint32_t uid, uint32_t gid) const;
  void resume();
  void suspend();
  // Stops the listener, every accepted connection and the audit source, then drains the
  // input queue: every event already read has been dispatched when it returns, and none
  // is read afterwards.
  void stopListening();
  void beginListening();
  void setEventFilterUID(std::optional<IdSet> uids, std::optional<IdSet> gids);

  // After each event a socket or the pipe delivered: closes the input queue's read gate
  // while the processing queue is over its limit; the queue's progress descriptor opens it
  // again once the backlog is down to the low mark.
  void applyBackPressure();
  // The input queue; nullptr before the first beginListening.
  EventLoop* inputQueue() const { return mInputEvtQ.get(); }
  // How often the read gate was closed, and for how long in all (the pause under way
  // included). Any thread.
  struct BackPressure {
    uint64_t pauses = 0;
    double seconds = 0;
  };
  BackPressure backPressure() const;
  // Events handed to the engine from one source. Any thread.
  uint64_t eventsFrom(EventSource source) const {
    return mEventsFrom[static_cast<size_t>(source)].load(std::memory_order_relaxed);
  }

 private:
  void onBacklogProgress();

  void countEvent(EventSource source) {
    mEventsFrom[static_cast<size_t>(source)].fetch_add(1, std::memory_order_relaxed);
  }

  std::array<std::atomic<uint64_t>, static_cast<size_t>(EventSource::kCount)> mEventsFrom{};
  std::atomic<uint64_t> mPauses{0};
  std::atomic<double> mPausedSeconds{0};  // of the pauses that ended
  std::atomic<double> mPausedSince{0};    // monotonic seconds; 0 while the gate is open

  std::unique_ptr<EventListener> mXPCEventConnection;
  std::unique_ptr<EventLoop> mInputEvtQ;
  int mAuditpipe = -1;
  uint64_t mEventBufferSize = 0;
  std::unique_ptr<AuditReadSource> mBSMReadSource;
  std::unique_ptr<IoSource> mProgressSource;
  std::unique_ptr<SshJournalSource> mSshJournal;
  std::string mAuthLogSource = "auditpipe";
  std::string mJournalCursorPath;
  std::optional<IdSet> mAllowedUIDs;
  std::optional<IdSet> mAllowedGIDs;

  MonitorHooks mHooks;
  std::string mEventSocketPath;
  int64_t mConnectionIdleTimeout = kDefaultConnectionIdleTimeout;
  int64_t mMaxConnectionsPerUID = kDefaultMaxConnectionsPerUID;
  // Accepted connections outlive the listener: stopping it does not cancel them.
  std::unique_ptr<PeerConnections> mPeers;
};

}  // namespace tarvod
