// Keychain variables. The store of secrets is not wired in yet, so every address has no
// password: a "keychain:" reference behaves like any variable without a value. The lookup
// through the store replaces this body; its callers stay as they are.

#include "context/keychain.h"

namespace tarvod {

std::optional<std::string> ResolveKeychain(std::string_view address) { return std::nullopt; }

}  // namespace tarvod
