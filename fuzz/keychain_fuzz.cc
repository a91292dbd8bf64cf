// The keychain store: any bytes as the store's property list, an item looked up by a service
// and account taken from the input's first line, and the masking of text that holds secrets.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "context/keychain.h"
#include "plist/codec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  const size_t line = input.find('\n');
  const std::string_view address = line == std::string_view::npos ? "" : input.substr(0, line);
  const std::string_view store = line == std::string_view::npos ? input : input.substr(line + 1);
  const size_t at = address.find('@');
  const std::string_view account = address.substr(0, at);
  const std::string_view service = at == std::string_view::npos ? "" : address.substr(at + 1);
  std::optional<plist::Value> items = plist::ReadPropertyList(store);
  if (!items || !items->isArray()) return 0;
  tarvod::FindKeychainItem(items->array(), service, account);
  tarvod::Keychain keychain("/nonexistent");
  for (const plist::Value& item : items->array()) {
    if (const plist::Dictionary* entry = item.asDictionary()) {
      if (const std::string* password = entry->findString("password")) {
        keychain.rememberPassword(*password);
      }
    }
  }
  keychain.mask(store);
  return 0;
}
