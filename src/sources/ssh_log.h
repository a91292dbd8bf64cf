// sshd's log lines as authentication events: the parser of the lines sshd writes about each
// login attempt, and the event a recognised line becomes. Pure functions, any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "plist/value.h"

namespace tarvod {

struct SshLogin {
  bool success = false;
  std::string username;  // as sshd printed it; empty when the line names none
  std::string clientIP;
  std::optional<int64_t> clientPort;
  std::string authMethod;  // "password", "publickey", "keyboard-interactive", "none"; may be empty
};

// The login attempt one sshd message reports; nullopt for any other message. The address and
// port are read from the end of the line, so that a user name holding spaces or the word
// "from" cannot move them.
std::optional<SshLogin> ParseSshLogLine(std::string_view message);

// { eventType auth.success|auth.failure, eventSource "Journal", eventTimestamp, eventDetails
// { clientIP, clientPort, authMethod, message, protocolName "SSH", username } }.
plist::Dictionary SshLoginEvent(const SshLogin& login, std::string_view message, double timestamp);

}  // namespace tarvod
