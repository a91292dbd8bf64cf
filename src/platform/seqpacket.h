// Unix SOCK_SEQPACKET sockets: the event socket's listening side (daemon, input queue thread)
// and its sending side (tarvodctl, tests, benchmarks). One packet carries one message. Every
// call may be made from any thread; errno is turned into the error fields here.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace tarvod {

struct SocketResult {
  int fd = -1;        // the descriptor, or -1
  std::string error;  // why fd is -1
  // Of the socket file a listener created, so that only that file is removed later.
  dev_t device = 0;
  ino_t inode = 0;
};

// Creates the listening socket at path (non-blocking, close-on-exec): missing parent
// directories are created with mode 0755, a socket file left by an earlier run is replaced,
// and the socket is made 0666 so that any local process may connect. Fails, removing
// nothing, when the path holds anything other than a socket, or a socket that another
// process still listens on.
SocketResult ListenSeqpacket(const std::string& path, int backlog);
// Removes the socket file at path when it is still the one ListenSeqpacket created.
void RemoveSeqpacketPath(const std::string& path, const SocketResult& listener);

// Accepts one connection, non-blocking and close-on-exec, set up for ReceivePacket to tell an
// empty packet from the end of the connection; -1 with errno set.
int AcceptSeqpacket(int listenFd);

struct PeerCredentials {
  uint32_t uid = 0;  // effective IDs of the peer when it connected
  uint32_t gid = 0;
  pid_t pid = 0;
};
bool ReadPeerCredentials(int fd, PeerCredentials* credentials);

enum class ReceiveStatus {
  kMessage,     // *length bytes are in the buffer
  kOversize,    // a packet longer than the buffer arrived and was discarded; *length is its size
  kEmpty,       // an empty packet
  kClosed,      // the peer has closed, and every packet it sent has been received
  kWouldBlock,  // nothing pending
  kError,       // the connection failed; errno is in *length
};
// Receives exactly one packet into buffer (whose size is the limit), on a descriptor from
// AcceptSeqpacket.
ReceiveStatus ReceivePacket(int fd, std::vector<uint8_t>& buffer, size_t* length);
// Whether a packet, or the end of the connection, waits to be received.
bool PacketPending(int fd);

// Connects to the socket at path (blocking); the error names the path and the reason.
SocketResult ConnectSeqpacket(const std::string& path);
// Sends one packet, raising the send buffer as far as needed (and allowed) for its size.
// Blocks while the receiver's queue is full. False with a reason on failure.
bool SendPacket(int fd, std::string_view bytes, std::string* error);

}  // namespace tarvod
