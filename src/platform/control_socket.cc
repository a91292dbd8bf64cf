#include "platform/control_socket.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "platform/worker_thread.h"

namespace tarvod {
namespace {

constexpr int kListenBacklog = 8;
// A client has this long to send its request once connected.
constexpr int kRequestTimeoutMs = 1000;
// Answers are cut to this size.
constexpr size_t kMaxAnswerBytes = 1 << 20;

}  // namespace

std::unique_ptr<ControlSocket> ControlSocket::Start(const std::string& path, Answer answer,
                                                    std::string* error) {
  SocketResult listener = ListenSeqpacket(path, kListenBacklog);
  if (listener.fd < 0) {
    *error = listener.error;
    return nullptr;
  }
  // Root's alone; the credentials are checked on every connection as well.
  if (chmod(path.c_str(), 0600) != 0) {
    *error = "cannot make " + path + " root-only: " + std::strerror(errno);
    RemoveSeqpacketPath(path, listener);
    close(listener.fd);
    return nullptr;
  }
  const int stopFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (stopFd < 0) {
    *error = std::string("eventfd: ") + std::strerror(errno);
    RemoveSeqpacketPath(path, listener);
    close(listener.fd);
    return nullptr;
  }
  std::unique_ptr<ControlSocket> socket(
      new ControlSocket(path, std::move(listener), stopFd, std::move(answer)));
  socket->mThread = StartWorkerThread([raw = socket.get()] { raw->run(); });
  return socket;
}

ControlSocket::ControlSocket(std::string path, SocketResult listener, int stopFd, Answer answer)
    : mPath(std::move(path)),
      mListener(std::move(listener)),
      mStopFd(stopFd),
      mAnswer(std::move(answer)) {}

ControlSocket::~ControlSocket() {
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t n = write(mStopFd, &one, sizeof one);
  if (mThread.joinable()) mThread.join();
  RemoveSeqpacketPath(mPath, mListener);
  close(mListener.fd);
  close(mStopFd);
}

void ControlSocket::run() {
  for (;;) {
    pollfd fds[2] = {{mListener.fd, POLLIN, 0}, {mStopFd, POLLIN, 0}};
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if (fds[1].revents != 0) return;
    const int fd = AcceptSeqpacket(mListener.fd);
    if (fd < 0) continue;
    serve(fd);
    close(fd);
  }
}

void ControlSocket::serve(int fd) {
  std::string ignored;
  PeerCredentials peer;
  if (!ReadPeerCredentials(fd, &peer) || peer.uid != 0) {
    SendPacket(fd, "refused: the control socket answers root only", &ignored);
    return;
  }
  pollfd readable = {fd, POLLIN, 0};
  if (poll(&readable, 1, kRequestTimeoutMs) <= 0) return;
  std::vector<uint8_t> buffer(kMaxControlRequestBytes);
  size_t length = 0;
  if (ReceivePacket(fd, buffer, &length) != ReceiveStatus::kMessage) {
    SendPacket(fd, "refused: no request", &ignored);
    return;
  }
  std::string answer = mAnswer(std::string(buffer.begin(), buffer.begin() + length));
  if (answer.size() > kMaxAnswerBytes) answer.resize(kMaxAnswerBytes);
  SendPacket(fd, answer, &ignored);
}

std::optional<std::string> AskControlSocket(const std::string& path, const std::string& request,
                                            std::string* error) {
  const SocketResult connection = ConnectSeqpacket(path);
  if (connection.fd < 0) {
    *error = connection.error;
    return std::nullopt;
  }
  std::optional<std::string> answer;
  if (SendPacket(connection.fd, request, error)) {
    std::vector<char> buffer(kMaxAnswerBytes + 1);
    const ssize_t got = recv(connection.fd, buffer.data(), buffer.size(), 0);
    if (got > 0) {
      answer.emplace(buffer.data(), static_cast<size_t>(got));
    } else {
      *error = got < 0 ? std::strerror(errno) : "the daemon closed the connection";
    }
  }
  close(connection.fd);
  return answer;
}

}  // namespace tarvod
