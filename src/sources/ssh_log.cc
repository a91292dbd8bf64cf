#include "sources/ssh_log.h"

#include <arpa/inet.h>

#include <array>

namespace tarvod {
namespace {

bool StartsWith(std::string_view text, std::string_view prefix) {
  return text.substr(0, prefix.size()) == prefix;
}

bool ConsumePrefix(std::string_view& text, std::string_view prefix) {
  if (!StartsWith(text, prefix)) return false;
  text.remove_prefix(prefix.size());
  return true;
}

bool IsAddress(std::string_view text) {
  if (text.empty() || text.size() >= INET6_ADDRSTRLEN) return false;
  char buffer[INET6_ADDRSTRLEN];
  text.copy(buffer, text.size());
  buffer[text.size()] = '\0';
  unsigned char address[sizeof(in6_addr)];
  return inet_pton(AF_INET, buffer, address) == 1 || inet_pton(AF_INET6, buffer, address) == 1;
}

// "HEAD <ip> port <n>[ ssh2[: ...]]" or "HEAD <ip>", split from the end: head, address and
// port. nullopt when the address is no IPv4 or IPv6 address.
struct Tail {
  std::string_view head;
  std::string_view ip;
  std::optional<int64_t> port;
};

std::optional<Tail> SplitTail(std::string_view line) {
  Tail tail;
  std::string_view rest = line;
  if (const size_t at = line.rfind(" port "); at != std::string_view::npos) {
    std::string_view digits = line.substr(at + 6);
    const size_t end = digits.find(' ');
    digits = digits.substr(0, end);
    // At most five digits, so the value is computed only when it fits.
    int64_t port = 0;
    const bool numeric = !digits.empty() && digits.size() <= 5 &&
                         digits.find_first_not_of("0123456789") == std::string_view::npos;
    for (char c : numeric ? digits : std::string_view()) port = port * 10 + (c - '0');
    if (numeric) {
      tail.port = port;
      rest = line.substr(0, at);
    }
  }
  const size_t space = rest.rfind(' ');
  if (space == std::string_view::npos) return std::nullopt;
  tail.ip = rest.substr(space + 1);
  tail.head = rest.substr(0, space);
  if (!IsAddress(tail.ip)) return std::nullopt;
  return tail;
}

// sshd names "keyboard-interactive/pam" after its device; rules see the method alone.
std::string MethodName(std::string_view method) {
  return std::string(method.substr(0, method.find('/')));
}

// "<user> from <ip> port <n>...", with an optional "invalid user " before the user.
std::optional<SshLogin> UserFromAddress(std::string_view rest, bool success, std::string method) {
  std::optional<Tail> tail = SplitTail(rest);
  if (!tail) return std::nullopt;
  std::string_view head = tail->head;
  if (head.size() < 5 || head.substr(head.size() - 5) != " from") return std::nullopt;
  head.remove_suffix(5);
  ConsumePrefix(head, "invalid user ");
  return SshLogin{success, std::string(head), std::string(tail->ip), tail->port, std::move(method)};
}

// "<user> <ip> port <n>".
std::optional<SshLogin> UserAddress(std::string_view rest) {
  std::optional<Tail> tail = SplitTail(rest);
  if (!tail) return std::nullopt;
  return SshLogin{false, std::string(tail->head), std::string(tail->ip), tail->port, ""};
}

// "pam_unix(sshd:auth): authentication failure; logname= uid=0 ... rhost=<ip>  user=<user>".
std::optional<SshLogin> PamFailure(std::string_view line) {
  if (line.find("(sshd:auth): authentication failure;") == std::string_view::npos) {
    return std::nullopt;
  }
  const size_t rhost = line.find(" rhost=");
  if (rhost == std::string_view::npos) return std::nullopt;
  std::string_view ip = line.substr(rhost + 7);
  ip = ip.substr(0, ip.find(' '));
  if (!IsAddress(ip)) return std::nullopt;
  std::string user;
  if (const size_t at = line.rfind(" user="); at != std::string_view::npos && at > rhost) {
    user = std::string(line.substr(at + 6));
  }
  return SshLogin{false, std::move(user), std::string(ip), std::nullopt, "password"};
}

}  // namespace

std::optional<SshLogin> ParseSshLogLine(std::string_view line) {
  if (line.size() > 9 && line.substr(line.size() - 9) == " [preauth]") line.remove_suffix(9);
  // The key fingerprint after "ssh2: " and the protocol word carry no address.
  if (const size_t at = line.rfind(" ssh2"); at != std::string_view::npos) {
    if (line.substr(at + 5).empty() || line[at + 5] == ':') line = line.substr(0, at);
  }
  std::string_view rest = line;
  const bool accepted = ConsumePrefix(rest, "Accepted ");
  if (accepted || ConsumePrefix(rest, "Failed ")) {
    const size_t forAt = rest.find(" for ");
    if (forAt == std::string_view::npos) return std::nullopt;
    return UserFromAddress(rest.substr(forAt + 5), accepted, MethodName(rest.substr(0, forAt)));
  }
  if (ConsumePrefix(rest, "Invalid user ")) return UserFromAddress(rest, false, "none");
  if (ConsumePrefix(rest, "error: maximum authentication attempts exceeded for ")) {
    return UserFromAddress(rest, false, "");
  }
  for (std::string_view prefix :
       {"Connection closed by authenticating user ", "Connection closed by invalid user ",
        "Disconnected from authenticating user ", "Disconnected from invalid user "}) {
    if (ConsumePrefix(rest, prefix)) return UserAddress(rest);
  }
  return PamFailure(line);
}

plist::Dictionary SshLoginEvent(const SshLogin& login, std::string_view message, double timestamp) {
  plist::Dictionary details{
      {"clientIP", plist::Value(login.clientIP)},
      {"message", plist::Value(message)},
      {"protocolName", plist::Value("SSH")},
      {"username", plist::Value(login.username)},
  };
  if (login.clientPort) details.set("clientPort", plist::Value::Integer(*login.clientPort));
  if (!login.authMethod.empty()) details.set("authMethod", plist::Value(login.authMethod));
  return plist::Dictionary{
      {"eventType", plist::Value(login.success ? "auth.success" : "auth.failure")},
      {"eventSource", plist::Value("Journal")},
      {"eventTimestamp", plist::Value::Real(timestamp)},
      {"eventDetails", plist::Value(std::move(details))},
  };
}

}  // namespace tarvod
