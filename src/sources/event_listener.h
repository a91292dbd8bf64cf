// The event socket: a Unix SOCK_SEQPACKET listener on which other processes send event
// dictionaries, one property list (XML or binary) per packet. Senders are admitted by the
// Monitor's filter on their effective IDs. Everything here runs on the input queue's thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/seqpacket.h"
#include "plist/value.h"

namespace tarvod {

class EventLoop;
class IoSource;
class Monitor;

inline constexpr const char* kDefaultEventSocketPath = "/run/tarvod/com.quenta.tarvod.evtq";
// Larger packets are malformed messages.
inline constexpr size_t kMaxEventMessageBytes = 1024 * 1024;
// Open connections at most; further connections wait in the listen backlog until one closes.
inline constexpr size_t kMaxPeerConnections = 256;

// The property list one packet carries: nullopt when the packet is empty, in neither wire
// format (XML or binary) or malformed. Pure; any thread.
std::optional<plist::Value> ReadEventPacket(std::string_view packet);

// The message dictionary with senderUID and senderGID added ("%d" of the effective IDs)
// unless the sender set them.
std::optional<plist::Dictionary> ConvertXPCEvent(plist::Dictionary message, uint32_t uid,
                                                 uint32_t gid);

// The admitted connections. They live as long as the Monitor, not the listener.
class PeerConnections {
 public:
  PeerConnections(Monitor& monitor, EventLoop& queue);
  ~PeerConnections();
  PeerConnections(const PeerConnections&) = delete;
  PeerConnections& operator=(const PeerConnections&) = delete;

  size_t size() const { return mPeers.size(); }
  bool full() const { return mPeers.size() >= kMaxPeerConnections; }
  // Whether the user may open one more connection (the Monitor's per-user limit).
  bool admits(uint32_t uid) const;
  // Takes ownership of an admitted connection.
  void add(int fd, const PeerCredentials& credentials);
  // Called whenever a connection has closed.
  void setSlotFreedHandler(std::function<void()> handler) { mSlotFreed = std::move(handler); }

 private:
  struct Peer;
  void onReadable(Peer& peer, uint32_t events);
  void handleMessage(Peer& peer, size_t length);
  void cancel(Peer& peer);
  // Closes the connections idle for the Monitor's timeout and sets the next look at them.
  void closeIdlePeers();
  void scheduleIdleCheck();

  Monitor& mMonitor;
  EventLoop& mQueue;
  std::map<uint64_t, std::unique_ptr<Peer>> mPeers;
  std::map<uint32_t, size_t> mPeersPerUID;
  bool mIdleCheckScheduled = false;
  uint64_t mNextId = 0;
  std::vector<uint8_t> mBuffer;  // one packet; shared, since the queue is serial
  std::function<void()> mSlotFreed;
  // Expires with this object, so that a posted clean-up finds it gone.
  std::shared_ptr<int> mLifetime = std::make_shared<int>(0);
};

// The listening socket. Destroying it stops accepting and removes its socket file.
class EventListener {
 public:
  // nullptr (after logging why at level 2) when the socket cannot be set up.
  static std::unique_ptr<EventListener> Create(Monitor& monitor, EventLoop& queue,
                                               PeerConnections& peers, const std::string& path);
  ~EventListener();
  EventListener(const EventListener&) = delete;
  EventListener& operator=(const EventListener&) = delete;

  void suspend();
  void resume();

 private:
  EventListener(Monitor& monitor, EventLoop& queue, PeerConnections& peers, std::string path,
                SocketResult socket);
  void onAcceptable();
  void updateAccepting();

  Monitor& mMonitor;
  EventLoop& mQueue;
  PeerConnections& mPeers;
  const std::string mPath;
  SocketResult mSocket;
  std::unique_ptr<IoSource> mSource;
  bool mSuspended = false;
  bool mBackingOff = false;  // after running out of descriptors
  // Expires with the listener, so that a pending back-off timer finds it gone.
  std::shared_ptr<int> mLifetime = std::make_shared<int>(0);
};

}  // namespace tarvod
