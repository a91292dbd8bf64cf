#include "sources/ssh_log.h"

#include <gtest/gtest.h>

#include <vector>

namespace tarvod {
namespace {

struct Case {
  const char* line;
  bool success;
  const char* user;
  const char* ip;
  int64_t port;  // -1: none
  const char* method;
};

TEST(SshLogLine, EveryFormOfALoginAttemptGivesUserAddressPortAndMethod) {
  const std::vector<Case> cases = {
      {"Accepted password for alice from 192.0.2.7 port 51234 ssh2", true, "alice", "192.0.2.7",
       51234, "password"},
      {"Accepted publickey for alice from 2001:db8::1 port 22 ssh2: ED25519 SHA256:Zm9v", true,
       "alice", "2001:db8::1", 22, "publickey"},
      {"Failed password for root from 192.0.2.7 port 4 ssh2", false, "root", "192.0.2.7", 4,
       "password"},
      {"Failed password for invalid user bob from 192.0.2.8 port 5 ssh2", false, "bob", "192.0.2.8",
       5, "password"},
      {"Failed none for invalid user bob from 192.0.2.8 port 5 ssh2", false, "bob", "192.0.2.8", 5,
       "none"},
      {"Failed keyboard-interactive/pam for carol from ::ffff:192.0.2.9 port 6 ssh2", false,
       "carol", "::ffff:192.0.2.9", 6, "keyboard-interactive"},
      {"Invalid user bob from 192.0.2.8 port 5", false, "bob", "192.0.2.8", 5, "none"},
      {"Invalid user bob from 192.0.2.8", false, "bob", "192.0.2.8", -1, "none"},
      {"Connection closed by authenticating user alice 192.0.2.7 port 7 [preauth]", false, "alice",
       "192.0.2.7", 7, ""},
      {"Connection closed by invalid user bob 2001:db8::2 port 8 [preauth]", false, "bob",
       "2001:db8::2", 8, ""},
      {"Disconnected from invalid user bob 192.0.2.8 port 9 [preauth]", false, "bob", "192.0.2.8",
       9, ""},
      {"error: maximum authentication attempts exceeded for root from 192.0.2.7 port 10 ssh2 "
       "[preauth]",
       false, "root", "192.0.2.7", 10, ""},
      {"pam_unix(sshd:auth): authentication failure; logname= uid=0 euid=0 tty=ssh ruser= "
       "rhost=192.0.2.7  user=alice",
       false, "alice", "192.0.2.7", -1, "password"},
      {"pam_unix(sshd:auth): authentication failure; logname= uid=0 euid=0 tty=ssh ruser= "
       "rhost=2001:db8::3",
       false, "", "2001:db8::3", -1, "password"},
      // A hostile name: spaces, the word "from", an address and a port of its own.
      {"Failed password for invalid user x from 10.0.0.1 port 1 from 192.0.2.7 port 11 ssh2", false,
       "x from 10.0.0.1 port 1", "192.0.2.7", 11, "password"},
      {"Invalid user a b \xff from 192.0.2.7 port 12", false, "a b \xff", "192.0.2.7", 12, "none"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.line);
    const std::optional<SshLogin> login = ParseSshLogLine(c.line);
    ASSERT_TRUE(login);
    EXPECT_EQ(login->success, c.success);
    EXPECT_EQ(login->username, c.user);
    EXPECT_EQ(login->clientIP, c.ip);
    EXPECT_EQ(login->clientPort, c.port < 0 ? std::nullopt : std::optional<int64_t>(c.port));
    EXPECT_EQ(login->authMethod, c.method);
  }
}

TEST(SshLogLine, OtherLinesAndLinesWithoutAnAddressAreNoLogin) {
  for (const char* line : {"Server listening on 0.0.0.0 port 22.",
                           "Received disconnect from "
                           "192.0.2.7 port 5:11: Bye Bye [preauth]",
                           "Accepted password for alice from nowhere port 1 ssh2",
                           "Failed password for", "Invalid user bob from 999.1.1.1", "",
                           "pam_unix(sshd:session): session opened for user alice"}) {
    EXPECT_FALSE(ParseSshLogLine(line)) << line;
  }
}

TEST(SshLogLine, TheEventCarriesTheDetailsOfTheAttempt) {
  const std::string message = "Failed password for root from 192.0.2.7 port 4 ssh2";
  const plist::Dictionary event = SshLoginEvent(*ParseSshLogLine(message), message, 12.5);
  const plist::Dictionary expected{
      {"eventType", "auth.failure"},
      {"eventSource", "Journal"},
      {"eventTimestamp", plist::Value::Real(12.5)},
      {"eventDetails", plist::Dictionary{{"clientIP", "192.0.2.7"},
                                         {"message", message},
                                         {"protocolName", "SSH"},
                                         {"username", "root"},
                                         {"clientPort", plist::Value::Integer(4)},
                                         {"authMethod", "password"}}}};
  EXPECT_EQ(event, expected);
}

}  // namespace
}  // namespace tarvod
