#include "platform/seqpacket.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace tarvod {
namespace {

std::string ErrorText(int error) { return std::strerror(error); }

bool MakeAddress(const std::string& path, sockaddr_un* address, std::string* error) {
  std::memset(address, 0, sizeof *address);
  address->sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address->sun_path) {
    *error = "socket path is empty or longer than " + std::to_string(sizeof address->sun_path - 1) +
             " bytes";
    return false;
  }
  std::memcpy(address->sun_path, path.data(), path.size());
  return true;
}

// Creates the missing directories above path, each with mode 0755.
bool MakeParentDirectories(const std::string& path, std::string* error) {
  for (size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    const std::string directory = path.substr(0, slash);
    if (mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) {
      *error = "cannot create " + directory + ": " + ErrorText(errno);
      return false;
    }
  }
  return true;
}

// True when some process accepts connections on the socket at address.
bool SomeoneListens(const sockaddr_un& address) {
  const int probe = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  if (probe < 0) return false;
  const bool connected =
      connect(probe, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  close(probe);
  return connected;
}

}  // namespace

SocketResult ListenSeqpacket(const std::string& path, int backlog) {
  SocketResult result;
  sockaddr_un address;
  if (!MakeAddress(path, &address, &result.error)) return result;
  if (!MakeParentDirectories(path, &result.error)) return result;

  struct stat existing;
  if (lstat(path.c_str(), &existing) == 0) {
    if (!S_ISSOCK(existing.st_mode)) {
      result.error = path + " exists and is not a socket";
      return result;
    }
    if (SomeoneListens(address)) {
      result.error = "another process listens on " + path;
      return result;
    }
    if (unlink(path.c_str()) != 0 && errno != ENOENT) {
      result.error = "cannot remove the stale socket " + path + ": " + ErrorText(errno);
      return result;
    }
  }

  const int fd = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (fd < 0) {
    result.error = "socket: " + ErrorText(errno);
    return result;
  }
  if (bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    result.error = "cannot bind " + path + ": " + ErrorText(errno);
    close(fd);
    return result;
  }
  if (chmod(path.c_str(), 0666) != 0 || listen(fd, backlog) != 0) {
    result.error = "cannot listen on " + path + ": " + ErrorText(errno);
    unlink(path.c_str());
    close(fd);
    return result;
  }
  struct stat created;
  if (lstat(path.c_str(), &created) == 0) {
    result.device = created.st_dev;
    result.inode = created.st_ino;
  }
  result.fd = fd;
  return result;
}

void RemoveSeqpacketPath(const std::string& path, const SocketResult& listener) {
  struct stat onDisk;
  if (lstat(path.c_str(), &onDisk) != 0) return;
  // Another process may have put its own file there since; leave that one alone.
  if (onDisk.st_dev != listener.device || onDisk.st_ino != listener.inode) return;
  unlink(path.c_str());
}

int AcceptSeqpacket(int listenFd) {
  const int fd = accept4(listenFd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
  if (fd < 0) return -1;
  // With credentials passed, every packet, even an empty one, arrives with a control message,
  // and the end of the connection without one: both read as zero bytes otherwise. Packets
  // queued before this call get theirs too.
  const int on = 1;
  if (setsockopt(fd, SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0) {
    const int error = errno;
    close(fd);
    errno = error;
    return -1;
  }
  return fd;
}

bool ReadPeerCredentials(int fd, PeerCredentials* credentials) {
  ucred peer;
  socklen_t length = sizeof peer;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return false;
  credentials->uid = peer.uid;
  credentials->gid = peer.gid;
  credentials->pid = peer.pid;
  return true;
}

ReceiveStatus ReceivePacket(int fd, std::vector<uint8_t>& buffer, size_t* length) {
  iovec data{buffer.data(), buffer.size()};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
  msghdr message{};
  message.msg_iov = &data;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  // MSG_TRUNC makes recvmsg return the packet's real length, so an oversize packet is seen as
  // such (and discarded whole) instead of being cut into a valid-looking prefix.
  const ssize_t got = recvmsg(fd, &message, MSG_TRUNC | MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (got < 0) {
    if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)
      return ReceiveStatus::kWouldBlock;
    *length = static_cast<size_t>(errno);
    return ReceiveStatus::kError;
  }
  *length = static_cast<size_t>(got);
  // A packet carries the sender's credentials (see AcceptSeqpacket); the end does not.
  if (got == 0) {
    return CMSG_FIRSTHDR(&message) != nullptr ? ReceiveStatus::kEmpty : ReceiveStatus::kClosed;
  }
  if (*length > buffer.size()) return ReceiveStatus::kOversize;
  return ReceiveStatus::kMessage;
}

bool PacketPending(int fd) {
  char byte;
  return recv(fd, &byte, sizeof byte, MSG_PEEK | MSG_DONTWAIT) >= 0;
}

SocketResult ConnectSeqpacket(const std::string& path) {
  SocketResult result;
  sockaddr_un address;
  if (!MakeAddress(path, &address, &result.error)) return result;
  const int fd = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    result.error = "socket: " + ErrorText(errno);
    return result;
  }
  if (connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    result.error = "cannot connect to " + path + ": " + ErrorText(errno);
    close(fd);
    return result;
  }
  result.fd = fd;
  return result;
}

bool SendPacket(int fd, std::string_view bytes, std::string* error) {
  // A packet must fit the sender's buffer whole; the default is about 200 KiB.
  int current = 0;
  socklen_t size = sizeof current;
  const int wanted = static_cast<int>(bytes.size() + 64 * 1024);
  if (getsockopt(fd, SOL_SOCKET, SO_SNDBUF, &current, &size) == 0 && current < wanted) {
    if (setsockopt(fd, SOL_SOCKET, SO_SNDBUFFORCE, &wanted, sizeof wanted) != 0) {
      setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &wanted, sizeof wanted);
    }
  }
  for (;;) {
    const ssize_t sent = send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (sent >= 0) return true;
    if (errno == EINTR) continue;
    if (errno == EMSGSIZE) {
      *error = "the message (" + std::to_string(bytes.size()) +
               " bytes) is larger than this process may send in one packet";
    } else {
      *error = "send: " + ErrorText(errno);
    }
    return false;
  }
}

}  // namespace tarvod
