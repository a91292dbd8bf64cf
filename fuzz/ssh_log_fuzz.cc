// sshd's journal lines: any message text through the login parser and, when it is a login,
// into its event.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "sources/ssh_log.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view line(reinterpret_cast<const char*>(data), size);
  if (std::optional<tarvod::SshLogin> login = tarvod::ParseSshLogLine(line)) {
    if (login->clientIP.empty()) __builtin_trap();  // a login always names its address
    plist::Describe(tarvod::SshLoginEvent(*login, line, 0));
  }
  return 0;
}
