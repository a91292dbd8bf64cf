#include "sources/event_listener.h"

#include <sys/epoll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <string_view>

#include "platform/diagnostic_log.h"
#include "platform/event_loop.h"
#include "plist/codec.h"
#include "sources/monitor.h"

namespace tarvod {
namespace {

constexpr int kListenBacklog = 128;
// After accept fails for want of descriptors, accepting pauses this long instead of spinning.
constexpr uint64_t kAcceptBackoffMicroseconds = 100'000;
// Packets one connection may deliver per wake-up of the input queue.
constexpr int kPacketsPerWake = 32;

// The wire carries XML and binary property lists only; the old-style text form (which would
// read almost any bytes as a string) is not a message format.
bool LooksLikeWireFormat(std::string_view bytes) {
  if (bytes.starts_with("bplist")) return true;
  if (bytes.starts_with("\xEF\xBB\xBF")) bytes.remove_prefix(3);
  while (!bytes.empty() && (bytes.front() == ' ' || bytes.front() == '\t' ||
                            bytes.front() == '\r' || bytes.front() == '\n')) {
    bytes.remove_prefix(1);
  }
  return bytes.starts_with("<");
}

// The IDs as the messages print them: "%d" of the 32-bit value.
int AsPrinted(uint32_t id) { return static_cast<int32_t>(id); }

uint64_t NowMicroseconds() {
  return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(
                                   std::chrono::steady_clock::now().time_since_epoch())
                                   .count());
}

}  // namespace

std::optional<plist::Value> ReadEventPacket(std::string_view packet) {
  if (packet.empty() || !LooksLikeWireFormat(packet)) return std::nullopt;
  return plist::ReadPropertyList(packet);
}

std::optional<plist::Dictionary> ConvertXPCEvent(plist::Dictionary message, uint32_t uid,
                                                 uint32_t gid) {
  LogMessage(3, "\tdictionary count = %d", static_cast<int>(message.size()));
  if (DebugLevel() >= 3) LogMessage(3, "event: %s:", plist::Describe(message).c_str());
  plist::Dictionary event = std::move(message);
  event.reserve(event.size() + 2);
  if (!event.contains("senderUID")) event.set("senderUID", std::to_string(AsPrinted(uid)));
  if (!event.contains("senderGID")) event.set("senderGID", std::to_string(AsPrinted(gid)));
  return event;
}

// ---- PeerConnections ----

struct PeerConnections::Peer {
  uint64_t id = 0;
  int fd = -1;
  PeerCredentials credentials;
  std::unique_ptr<IoSource> source;
  bool cancelled = false;
  uint64_t lastActivity = 0;  // when it connected or last sent a packet, in microseconds

  ~Peer() {
    source.reset();  // stop watching before the descriptor goes
    if (fd >= 0) close(fd);
  }
};

PeerConnections::PeerConnections(Monitor& monitor, EventLoop& queue)
    : mMonitor(monitor), mQueue(queue), mBuffer(kMaxEventMessageBytes) {}

PeerConnections::~PeerConnections() = default;

bool PeerConnections::admits(uint32_t uid) const {
  const int64_t limit = mMonitor.maxConnectionsPerUID();
  if (uid == 0 || limit <= 0) return true;
  const auto found = mPeersPerUID.find(uid);
  return found == mPeersPerUID.end() || found->second < static_cast<size_t>(limit);
}

void PeerConnections::add(int fd, const PeerCredentials& credentials) {
  auto peer = std::make_unique<Peer>();
  peer->id = mNextId++;
  peer->fd = fd;
  peer->credentials = credentials;
  peer->lastActivity = NowMicroseconds();
  Peer* raw = peer.get();
  peer->source = mQueue.addIo(fd, EPOLLIN | EPOLLRDHUP, /*gated=*/true,
                              [this, raw](uint32_t events) { onReadable(*raw, events); });
  if (!peer->source) {
    LogMessage(4, "unexpected peer error");
    return;  // the descriptor closes with the peer
  }
  mPeers.emplace(peer->id, std::move(peer));
  ++mPeersPerUID[credentials.uid];
  scheduleIdleCheck();
}

void PeerConnections::scheduleIdleCheck() {
  const int64_t timeout = mMonitor.connectionIdleTimeout();
  if (mIdleCheckScheduled || timeout <= 0 || mPeers.empty()) return;
  // The earliest moment a connection can have been idle for the whole timeout.
  uint64_t oldest = UINT64_MAX;
  for (const auto& [id, peer] : mPeers) {
    if (!peer->cancelled) oldest = std::min(oldest, peer->lastActivity);
  }
  if (oldest == UINT64_MAX) return;
  const uint64_t deadline = oldest + static_cast<uint64_t>(timeout) * 1'000'000;
  const uint64_t now = NowMicroseconds();
  mIdleCheckScheduled = mQueue.callLater(deadline > now ? deadline - now : 0,
                                         [this, alive = std::weak_ptr<int>(mLifetime)] {
                                           if (alive.expired()) return;
                                           mIdleCheckScheduled = false;
                                           closeIdlePeers();
                                         });
}

void PeerConnections::closeIdlePeers() {
  const int64_t timeout = mMonitor.connectionIdleTimeout();
  if (timeout <= 0) return;
  const uint64_t now = NowMicroseconds();
  const uint64_t limit = static_cast<uint64_t>(timeout) * 1'000'000;
  for (const auto& [id, peer] : mPeers) {
    if (peer->cancelled || now - peer->lastActivity < limit) continue;
    // A packet the daemon has not read yet (the read gate may be closed) is no idleness.
    if (!mQueue.readGateOpen() || PacketPending(peer->fd)) {
      peer->lastActivity = now;
      continue;
    }
    LogMessage(1, "Closing the connection from %d:%d (uid:gid): nothing sent for %lld seconds",
               AsPrinted(peer->credentials.uid), AsPrinted(peer->credentials.gid),
               static_cast<long long>(timeout));
    cancel(*peer);
  }
  scheduleIdleCheck();
}

void PeerConnections::onReadable(Peer& peer, uint32_t) {
  // Up to kPacketsPerWake packets per call, fewer once the read gate closes (back-pressure) or
  // the peer is cancelled; the loop calls again while more are queued, hang-up or not, so
  // every packet a peer sent before closing is handled. One wake-up then serves a run of
  // packets instead of one, and the other peers still get their turn in between.
  for (int taken = 0; taken < kPacketsPerWake && !peer.cancelled && mQueue.readGateOpen();
       ++taken) {
    size_t length = 0;
    switch (ReceivePacket(peer.fd, mBuffer, &length)) {
      case ReceiveStatus::kWouldBlock:
        return;
      case ReceiveStatus::kError:
        LogMessage(4, "peer error: %s", std::strerror(static_cast<int>(length)));
        cancel(peer);
        return;
      case ReceiveStatus::kClosed:
        LogMessage(4, "peer error: %s", "Connection invalid");
        cancel(peer);
        return;
      case ReceiveStatus::kEmpty:
        break;  // an empty packet: no property list
      case ReceiveStatus::kOversize:
        length = 0;  // nothing of it was kept
        break;
      case ReceiveStatus::kMessage:
        break;
    }
    peer.lastActivity = NowMicroseconds();
    handleMessage(peer, length);
  }
}

void PeerConnections::handleMessage(Peer& peer, size_t length) {
  const int uid = AsPrinted(peer.credentials.uid);
  const int gid = AsPrinted(peer.credentials.gid);
  std::optional<plist::Value> message =
      ReadEventPacket({reinterpret_cast<const char*>(mBuffer.data()), length});

  if (!message) {
    LogMessage(3, "_CFXPCCreateCFObjectFromXPCObject returned NULL");
    LogMessage(3, "XPC Malformed event received from %d:%d (uid:gid)", uid, gid);
    return;
  }
  plist::Dictionary* dictionary = message->asDictionary();
  if (dictionary == nullptr) {
    LogMessage(4, "unexpected peer event: %s", plist::Describe(*message).c_str());
    cancel(peer);
    return;
  }
  std::optional<plist::Dictionary> event =
      ConvertXPCEvent(std::move(*dictionary), peer.credentials.uid, peer.credentials.gid);
  if (!event) {
    LogMessage(3, "XPC Malformed event received from %d:%d (uid:gid)", uid, gid);
    return;
  }
  if (DebugLevel() >= 3) LogMessage(3, "XPC Event received: %s ", plist::Describe(*event).c_str());
  mMonitor.processEvent(std::move(*event));
  mMonitor.applyBackPressure();
}

void PeerConnections::cancel(Peer& peer) {
  // The peer's own handler is running: stop it now, free it once the handler has returned.
  peer.cancelled = true;
  peer.source->setEnabled(false);
  const uint64_t id = peer.id;
  mQueue.post([this, id, alive = std::weak_ptr<int>(mLifetime)] {
    if (alive.expired()) return;
    const auto found = mPeers.find(id);
    if (found == mPeers.end()) return;
    const uint32_t uid = found->second->credentials.uid;
    mPeers.erase(found);
    if (--mPeersPerUID[uid] == 0) mPeersPerUID.erase(uid);
    if (mSlotFreed) mSlotFreed();
  });
}

// ---- EventListener ----

std::unique_ptr<EventListener> EventListener::Create(Monitor& monitor, EventLoop& queue,
                                                     PeerConnections& peers,
                                                     const std::string& path) {
  SocketResult socket = ListenSeqpacket(path, kListenBacklog);
  if (socket.fd < 0) {
    // The daemon runs on without its event socket: say why where an administrator looks.
    LogMessage(0, "SetXPCListenerFor: %s", socket.error.c_str());
    ConsoleMessage("tarvod: the event socket cannot be opened: %s", socket.error.c_str());
    return nullptr;
  }
  std::unique_ptr<EventListener> listener(
      new EventListener(monitor, queue, peers, path, std::move(socket)));
  listener->mSource = queue.addIo(listener->mSocket.fd, EPOLLIN, /*gated=*/true,
                                  [raw = listener.get()](uint32_t) { raw->onAcceptable(); });
  if (!listener->mSource) {
    LogMessage(2, "SetXPCListenerFor: cannot watch %s", path.c_str());
    return nullptr;
  }
  peers.setSlotFreedHandler([raw = listener.get()] { raw->updateAccepting(); });
  return listener;
}

EventListener::EventListener(Monitor& monitor, EventLoop& queue, PeerConnections& peers,
                             std::string path, SocketResult socket)
    : mMonitor(monitor),
      mQueue(queue),
      mPeers(peers),
      mPath(std::move(path)),
      mSocket(std::move(socket)) {}

EventListener::~EventListener() {
  mPeers.setSlotFreedHandler(nullptr);
  mSource.reset();
  if (mSocket.fd >= 0) {
    RemoveSeqpacketPath(mPath, mSocket);
    close(mSocket.fd);
  }
}

void EventListener::suspend() {
  mSuspended = true;
  updateAccepting();
}

void EventListener::resume() {
  mSuspended = false;
  updateAccepting();
}

void EventListener::updateAccepting() {
  if (mSource) mSource->setEnabled(!mSuspended && !mBackingOff && !mPeers.full());
}

void EventListener::onAcceptable() {
  if (mPeers.full()) {
    updateAccepting();  // waits for a slot
    return;
  }
  const int fd = AcceptSeqpacket(mSocket.fd);
  if (fd < 0) {
    const int error = errno;
    if (error == EAGAIN || error == EWOULDBLOCK || error == EINTR || error == ECONNABORTED) {
      return;
    }
    LogMessage(2, "unexpected connection error: %s", std::strerror(error));
    if (error == EMFILE || error == ENFILE || error == ENOBUFS || error == ENOMEM) {
      mBackingOff = true;
      updateAccepting();
      mQueue.callLater(kAcceptBackoffMicroseconds, [this, alive = std::weak_ptr<int>(mLifetime)] {
        if (alive.expired()) return;
        mBackingOff = false;
        updateAccepting();
      });
    }
    return;
  }
  LogMessage(3, "XPC Connection EventHandler called");
  PeerCredentials credentials;
  if (!ReadPeerCredentials(fd, &credentials)) {
    LogMessage(2, "unexpected connection error: %s", std::strerror(errno));
    close(fd);
    return;
  }
  const int uid = AsPrinted(credentials.uid);
  const int gid = AsPrinted(credentials.gid);
  LogMessage(3, "XPC Connection Request recieved from %d:%d (uid:gid)", uid, gid);
  if (!mMonitor.filterBySourceUID(credentials.uid, credentials.gid)) {
    close(fd);
    LogMessage(3, "XPC Event rejected from %d:%d (uid:gid)", uid, gid);
    return;
  }
  if (!mPeers.admits(credentials.uid)) {
    close(fd);
    LogMessage(1, "XPC Connection refused from %d:%d (uid:gid): the user holds %lld connections",
               uid, gid, static_cast<long long>(mMonitor.maxConnectionsPerUID()));
    return;
  }
  mPeers.add(fd, credentials);
  if (mPeers.full()) updateAccepting();
}

}  // namespace tarvod
