// The Monitor: the one object through which events from outside the daemon enter the rule
// engine. It owns the input queue (a thread running its own event loop) on which the event
// socket and the audit pipe deliver, and the sender filter.
// Main thread: the constructor, setEventSocketPath, setEventFilterUID, beginListening,
// stopListening, suspend, resume, setRulebase. Input queue: filterBySourceUID,
// applyBackPressure. Any thread: processEvent, rulebase, getVariables.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "context/types.h"
#include "plist/value.h"

namespace tarvod {

class EventLoop;
class EventListener;
class PeerConnections;
class AuditReadSource;

using IdSet = std::set<int64_t>;

// A filterByUID / filterByGID text: the set of its comma-separated numbers, each read as a
// property-list string is read as an integer (no digits: 0); nullopt for an absent or empty
// text. A lone comma therefore gives { 0 }.
std::optional<IdSet> ParseFilterList(std::optional<std::string_view> text);

// What the Monitor hands events to, and where it reads the rule engine's backlog. Tests
// replace both; the two-argument constructor uses DispatchEvent and the processing queue.
struct MonitorHooks {
  std::function<void(const RulebasePtr&, const plist::Dictionary&, const VariableStorePtr&)>
      dispatch;
  // Jobs waiting on the processing queue; empty: no back-pressure.
  std::function<size_t()> backlog;
};

// While more jobs than kBackPressureHighJobs wait on the processing queue, the input queue
// reads no socket and no audit record; it reads again once at most kBackPressureLowJobs
// wait. Senders meanwhile wait in the kernel's socket buffers: nothing is dropped, and the
// events waiting inside the daemon stay below about kBackPressureHighJobs.
inline constexpr size_t kBackPressureHighJobs = 2048;
inline constexpr size_t kBackPressureLowJobs = 512;

// So that no local user can take every connection to the event socket: a connection that
// sends nothing for this many seconds is closed, and each user but root may hold this many
// connections at once.
inline constexpr int64_t kDefaultConnectionIdleTimeout = 60;
inline constexpr int64_t kDefaultMaxConnectionsPerUID = 32;

class Monitor {
 public:
  // initWithRulebase:andVariables: wired to the rule engine (DispatchEvent, ProcessingQueue).
  Monitor(RulebasePtr rulebase, VariableStorePtr variables);
  Monitor(RulebasePtr rulebase, VariableStorePtr variables, MonitorHooks hooks);
  // Stops every source and the input queue.
  ~Monitor();
  Monitor(const Monitor&) = delete;
  Monitor& operator=(const Monitor&) = delete;

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
  VariableStorePtr getVariables() const { return mVariables; }
  RulebasePtr rulebase() const;
  // The reload's one indivisible replacement of the rulebase.
  void setRulebase(RulebasePtr rulebase);
  void processEvent(const plist::Dictionary& event);
  bool filterBySourceUID(uint32_t uid, uint32_t gid) const;
  void resume();
  void suspend();
  // Stops the listener and the audit source, then drains the input queue: every event
  // already read has been dispatched when it returns.
  void stopListening();
  void beginListening();
  void setEventFilterUID(std::optional<IdSet> uids, std::optional<IdSet> gids);

  // After each event a socket or the pipe delivered: closes the input queue's read gate
  // while the processing queue is over its limit, and opens it again once it has drained.
  void applyBackPressure();
  // The input queue; nullptr before the first beginListening.
  EventLoop* inputQueue() const { return mInputEvtQ.get(); }

 private:
  void watchBacklog();

  mutable std::mutex mRulebaseLock;  // guards the reference only
  RulebasePtr mRulebase;
  VariableStorePtr mVariables;
  std::unique_ptr<EventListener> mXPCEventConnection;
  std::unique_ptr<EventLoop> mInputEvtQ;
  int mAuditpipe = -1;
  uint64_t mEventBufferSize = 0;
  std::unique_ptr<AuditReadSource> mBSMReadSource;
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
