// Keychain variables: the store's cache, the generic-password lookup, ResolveKeychain and the
// secret texts.

#include "context/keychain.h"

#include <algorithm>
#include <cerrno>
#include <vector>

#include "platform/diagnostic_log.h"
#include "plist/codec.h"

namespace tarvod {
namespace {

bool ItemIs(const plist::Value& item, std::string_view service, std::string_view account) {
  const plist::Dictionary* dictionary = item.asDictionary();
  if (dictionary == nullptr) return false;
  const std::string* itemService = dictionary->findString("service");
  const std::string* itemAccount = dictionary->findString("account");
  return itemService && itemAccount && *itemService == service && *itemAccount == account;
}

}  // namespace

std::optional<size_t> FindKeychainItem(const plist::Array& items, std::string_view service,
                                       std::string_view account) {
  for (size_t i = 0; i < items.size(); ++i) {
    if (ItemIs(items[i], service, account)) return i;
  }
  return std::nullopt;
}

Keychain::Keychain(std::string path) : mPath(std::move(path)) {}

void Keychain::forget() {
  mItems.reset();
  mStamp = FileStamp();
  mFailure = 0;
  mReported.reset();
}

int Keychain::openStore() {
  // One lstat per lookup: an unchanged store, usable or not, is not read again.
  Result<FileStamp> stamp = StampSecretFile(mPath);
  if (stamp.ok() && stamp.value() == mStamp && (mItems || mFailure != 0)) {
    return mItems ? 0 : mFailure;
  }
  int status = 0;
  std::string reason;
  if (!stamp.ok()) {
    status = stamp.status().error() == ENOENT ? kKeychainNotFound : kKeychainRefused;
    reason = stamp.status().what();
  } else if (Result<SecretFile> file = ReadSecretFile(mPath); !file.ok()) {
    status = file.status().error() == ENOENT ? kKeychainNotFound : kKeychainRefused;
    reason = file.status().what();
  } else {
    mStamp = file.value().stamp;
    std::optional<plist::Value> store = plist::ReadPropertyList(file.value().bytes);
    if (store && store->isArray()) {
      mItems = std::move(store->array());
      mFailure = 0;
      mReported.reset();
      return 0;
    }
    status = kKeychainInvalid;
    reason = mPath + " is not a property-list array";
  }
  mItems.reset();
  mFailure = status;
  if (!stamp.ok()) mStamp = FileStamp();
  // A store that stays unusable for one reason is reported once, however many lookups meet it.
  if (mReported != reason) {
    LogMessage(0, "ResolveKeychain: Can't open system keychain result = %d", status);
    LogMessage(0, "ResolveKeychain: %s", reason.c_str());
    mReported = reason;
  }
  return status;
}

Keychain::Lookup Keychain::findGenericPassword(std::string_view service, std::string_view account) {
  if (const int status = openStore(); status != 0) return Lookup{.status = status, .password = {}};
  const std::optional<size_t> index = FindKeychainItem(*mItems, service, account);
  if (!index) return Lookup{.status = kKeychainItemNotFound, .password = {}};
  const plist::Value* password = (*mItems)[*index].asDictionary()->find("password");
  if (password != nullptr && password->isString()) return Lookup{.password = password->string()};
  if (password != nullptr && password->isData()) {
    const plist::Data& bytes = password->data();
    return Lookup{.password = std::string(bytes.begin(), bytes.end())};
  }
  return Lookup{.status = kKeychainPasswordInvalid, .password = {}};
}

void Keychain::rememberPassword(const std::string& password) {
  if (password.empty() || !mPasswords.insert(password).second) return;
  addSecret(password);
}

void Keychain::rememberComputed(const std::string& text) {
  if (text.empty() || containsSecret(text)) return;
  if (mComputed.size() == kMaxComputedSecrets) {
    // The oldest computed text goes: a rule that mixes event data into arithmetic with a
    // password must not grow this without bound.
    const std::string oldest = std::move(mComputed.front());
    mComputed.pop_front();
    if (!mPasswords.contains(oldest)) std::erase(mSecrets, oldest);
  }
  mComputed.push_back(text);
  addSecret(text);
}

void Keychain::addSecret(const std::string& text) {
  mSecrets.insert(std::upper_bound(mSecrets.begin(), mSecrets.end(), text,
                                   [](const std::string& a, const std::string& b) {
                                     return a.size() > b.size();
                                   }),
                  text);
  std::fill(std::begin(mFirstBytes), std::end(mFirstBytes), false);
  for (const std::string& secret : mSecrets) {
    mFirstBytes[static_cast<unsigned char>(secret.front())] = true;
  }
}

bool Keychain::containsSecret(std::string_view text) const {
  for (const std::string& secret : mSecrets) {
    if (text.find(secret) != std::string_view::npos) return true;
  }
  return false;
}

bool Keychain::isSecret(const plist::Value& value) const {
  if (mSecrets.empty() || value.isArray() || value.isDictionary() || value.isData()) return false;
  if (const std::string* text = value.asString()) return containsSecret(*text);
  return containsSecret(value.textForm());
}

std::string Keychain::mask(std::string_view text) const {
  if (mSecrets.empty()) return std::string(text);
  std::string shown;
  shown.reserve(text.size());
  size_t i = 0;
  while (i < text.size()) {
    if (mFirstBytes[static_cast<unsigned char>(text[i])]) {
      const std::string_view rest = text.substr(i);
      const auto found = std::find_if(mSecrets.begin(), mSecrets.end(),
                                      [&](const std::string& s) { return rest.starts_with(s); });
      if (found != mSecrets.end()) {
        shown += kSecretPlaceholder;
        i += found->size();
        continue;
      }
    }
    shown.push_back(text[i++]);
  }
  return shown;
}

std::optional<std::string> ResolveKeychain(Keychain& keychain, std::string_view address) {
  // Exactly one "@": the account before it, the service after it; either may be empty.
  const size_t at = address.find('@');
  if (at == std::string_view::npos || address.find('@', at + 1) != std::string_view::npos) {
    const std::string shown = keychain.mask(address);
    LogMessage(0, "ResolveKeychain: Expected keychain address to be user@server not %s",
               shown.c_str());
    return std::nullopt;
  }
  const std::string account(address.substr(0, at));
  const std::string service(address.substr(at + 1));
  Keychain::Lookup found = keychain.findGenericPassword(service, account);
  if (found.status == kKeychainItemNotFound) return std::nullopt;
  if (found.status == kKeychainPasswordInvalid) {
    LogMessage(0,
               "ResolveKeychain: SecKeychainFindGenericPassword fails for user = %s server = %s  "
               "result = %d",
               account.c_str(), service.c_str(), found.status);
    return std::nullopt;
  }
  // A store that cannot be opened has been reported by the lookup.
  if (found.status != 0) return std::nullopt;
  if (!plist::IsValidUtf8(found.password)) return std::nullopt;
  keychain.rememberPassword(found.password);
  return std::move(found.password);
}

}  // namespace tarvod
