// Keychain variables: the passwords of the system keychain store, and the secret texts that
// traces, dumps and log lines show as kSecretPlaceholder.
//
// The store is a root-only property-list file (src/platform/secret_file.h) holding an array of
// items { service = ...; account = ...; password = string or data; }. It is read at the first
// lookup and read again only when its inode or modification time changes, or after forget().
//
// Threads: the Engine hands one Keychain to every Context it makes, and contexts run only on
// the processing queue (rules loading included), so a Keychain is confined to that queue and
// takes no lock. A unit test may use one from its own thread instead.
#pragma once

#include <deque>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/secret_file.h"
#include "plist/value.h"

namespace tarvod {

inline constexpr const char* kDefaultKeychainPath = "/etc/tarvod.d/system.keychain";
// What a log line shows in place of a secret text.
inline constexpr std::string_view kSecretPlaceholder = "<keychain value>";

// Lookup statuses. A missing item is the host's own status; the others are ours.
inline constexpr int kKeychainItemNotFound = -25300;
inline constexpr int kKeychainNotFound = -25294;         // nothing at the store's path
inline constexpr int kKeychainRefused = -25293;          // not a root-only regular file
inline constexpr int kKeychainInvalid = -25295;          // not a property-list array
inline constexpr int kKeychainPasswordInvalid = -26275;  // the item's password is no string or data

// The store's format, shared with tarvodctl: the index of the first item of items whose
// service and account are these; nullopt when none is.
std::optional<size_t> FindKeychainItem(const plist::Array& items, std::string_view service,
                                       std::string_view account);

class Keychain {
 public:
  explicit Keychain(std::string path);
  Keychain(const Keychain&) = delete;
  Keychain& operator=(const Keychain&) = delete;

  const std::string& path() const { return mPath; }

  // The generic-password lookup: status 0 with the password's bytes, kKeychainItemNotFound, or
  // the status of a store that cannot be opened. A store that cannot be opened is logged once
  // (at level 0, with its reason), not at every lookup.
  struct Lookup {
    int status = 0;
    std::string password;
  };
  Lookup findGenericPassword(std::string_view service, std::string_view account);
  // The next lookup reads the store again, and logs again why it cannot be opened.
  void forget();

  // Secret texts: every password a lookup has returned, and up to kMaxComputedSecrets texts
  // computed from secrets (a format suffix, arithmetic). They are kept for the life of the
  // process: variables hold them long after the lookup.
  void rememberPassword(const std::string& password);
  // Remembers text as computed from a secret, unless it already shows one.
  void rememberComputed(const std::string& text);
  bool hasSecrets() const { return !mPasswords.empty() || !mComputed.empty(); }
  // Whether the text form of a string or scalar value contains a secret text.
  bool isSecret(const plist::Value& value) const;
  // text with every secret text in it replaced by kSecretPlaceholder, longest first.
  std::string mask(std::string_view text) const;

  static constexpr size_t kMaxComputedSecrets = 256;

 private:
  // 0 when mItems holds the store as it is now; otherwise the store's failure status.
  int openStore();
  bool containsSecret(std::string_view text) const;
  void addSecret(const std::string& text);

  const std::string mPath;
  std::optional<plist::Array> mItems;    // the items last read; nullopt when not usable
  FileStamp mStamp;                      // of the version in mItems, or of the refused one
  int mFailure = 0;                      // status of the version at mStamp when refused
  std::optional<std::string> mReported;  // reason last logged; logged again when it changes

  std::set<std::string> mPasswords;
  std::deque<std::string> mComputed;
  // Every secret text, longest first, and which bytes start one: mask runs on every trace.
  std::vector<std::string> mSecrets;
  bool mFirstBytes[256] = {};
};

// ResolveKeychain: the password stored for address "account@server", decoded as UTF-8, or
// nullopt (the item is missing, the store cannot be opened, the address is malformed, or the
// password is not UTF-8). Logs its own failures.
std::optional<std::string> ResolveKeychain(Keychain& keychain, std::string_view address);

}  // namespace tarvod
