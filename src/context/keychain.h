// Keychain variables: the password stored for an address "user@server", fetched afresh on
// every "keychain:" lookup. Called from lookup on whichever thread uses the context.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tarvod {

// The password of the item for address, or nullopt when there is none or the store cannot be
// read. Logs its own failures.
std::optional<std::string> ResolveKeychain(std::string_view address);

}  // namespace tarvod
