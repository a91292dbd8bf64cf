// The control socket: root's request/response channel to the running daemon (`tarvodctl
// stats`, `tarvodctl status`). A SOCK_SEQPACKET socket of mode 0600 served by a thread of its
// own: each connection sends one request packet and receives one answer packet, then is
// closed. Callers whose effective user is not root are answered "refused" whatever the file's
// mode. The answer callback runs on the socket's thread.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "platform/seqpacket.h"
#include "platform/status.h"

namespace tarvod {

// The control socket sits beside the event socket.
inline std::string ControlSocketPath(const std::string& eventSocketPath) {
  return eventSocketPath + ".control";
}

// Longest request read; longer ones are answered "refused".
inline constexpr size_t kMaxControlRequestBytes = 256;

class ControlSocket {
 public:
  using Answer = std::function<std::string(const std::string& request)>;
  // Listens at path; nullptr with the reason in *error when the socket cannot be made.
  static std::unique_ptr<ControlSocket> Start(const std::string& path, Answer answer,
                                              std::string* error);
  // Stops the thread and removes the socket file.
  ~ControlSocket();
  ControlSocket(const ControlSocket&) = delete;
  ControlSocket& operator=(const ControlSocket&) = delete;

 private:
  ControlSocket(std::string path, SocketResult listener, int stopFd, Answer answer);
  void run();
  void serve(int fd);

  std::string mPath;
  SocketResult mListener;
  int mStopFd;
  Answer mAnswer;
  std::thread mThread;
};

// Sends request to the control socket at path and returns the answer; nullopt with the reason
// in *error.
std::optional<std::string> AskControlSocket(const std::string& path, const std::string& request,
                                            std::string* error);

}  // namespace tarvod
