// tarvodctl: sends an event to a running tarvod over its event socket, posts a distributed
// notification on the system bus, edits the keychain store that "keychain:" references read,
// checks rules and tests them against an event with the daemon's own loader and engine, and
// asks the running daemon for its counters over its root-only control socket.
//
//   tarvodctl [-c CONFIG] check [-r RULES] [--strict] [--json]
//   tarvodctl [-c CONFIG] test [-r RULES] TYPE [key=value ...] | --plist FILE
//   tarvodctl [-c CONFIG] stats|status [--socket PATH]
//   tarvodctl [-c CONFIG] send [--socket PATH] TYPE [key=value ...]
//   tarvodctl [-c CONFIG] send [--socket PATH] --plist FILE
//   tarvodctl post NAME OBJECT [key=value ...]
//   tarvodctl post --plist FILE NAME OBJECT
//   tarvodctl [-c CONFIG] keychain [--keychain PATH] set SERVICE ACCOUNT
//   tarvodctl [-c CONFIG] keychain [--keychain PATH] get|delete SERVICE ACCOUNT
//   tarvodctl [-c CONFIG] keychain [--keychain PATH] list
//
// send with TYPE sends { eventType = TYPE; eventDetails = { key = value; ... }; }, with --plist
// the dictionary in a property-list file; either is stamped with eventTimestamp (now, in
// seconds since 2001) unless it has one. Without --socket the path is the configuration
// file's eventSocketPath (default configuration /etc/tarvod.d/tarvod.plist), else the
// daemon's default. post posts the notification NAME with object OBJECT; its user information
// is { eventType = OBJECT; eventDetails = { key = value; ... }; }, the event the daemon's rules
// for OBJECT receive, or the dictionary in FILE. The keychain forms work on the
// configuration's keychainPath unless --keychain names the store; they run only as root. set
// reads the password from standard input (without echo on a terminal). Exit status: 0 done, 1
// failed (not sent, no such item, refused), 2 usage.
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "context/keychain.h"
#include "platform/clock.h"
#include "platform/control_socket.h"
#include "platform/files.h"
#include "platform/notification_center.h"
#include "platform/secret_file.h"
#include "platform/seqpacket.h"
#include "plist/codec.h"
#include "plist/value.h"
#include "sources/event_listener.h"
#include "tarvodctl_rules.h"

namespace {

constexpr const char* kDefaultConfiguration = "/etc/tarvod.d/tarvod.plist";

// A password longer than this is no password: set refuses it.
constexpr size_t kMaxPasswordBytes = 64 * 1024;

int Usage(FILE* out = stderr) {
  std::fprintf(out,
               "usage: tarvodctl [-c CONFIG] check [-r RULES] [--strict] [--json]\n"
               "       tarvodctl [-c CONFIG] test [-r RULES] TYPE [key=value ...]\n"
               "       tarvodctl [-c CONFIG] test [-r RULES] --plist FILE\n"
               "       tarvodctl [-c CONFIG] stats|status [--socket PATH]\n"
               "       tarvodctl [-c CONFIG] send [--socket PATH] TYPE [key=value ...]\n"
               "       tarvodctl [-c CONFIG] send [--socket PATH] --plist FILE\n"
               "       tarvodctl post NAME OBJECT [key=value ...]\n"
               "       tarvodctl post --plist FILE NAME OBJECT\n"
               "       tarvodctl [-c CONFIG] keychain [--keychain PATH] set|get|delete SERVICE "
               "ACCOUNT\n"
               "       tarvodctl [-c CONFIG] keychain [--keychain PATH] list\n");
  return out == stderr ? 2 : 0;
}

int Fail(const std::string& message) {
  std::fprintf(stderr, "tarvodctl: %s\n", message.c_str());
  return 1;
}

// The configuration file's config entry for key when it is a string, else fallback.
std::string ConfigurationPath(const std::string& configurationPath, std::string_view key,
                              const char* fallback) {
  if (const auto file = plist::ReadPropertyListFile(configurationPath)) {
    if (const plist::Dictionary* root = file->asDictionary()) {
      if (const plist::Dictionary* config = root->findDictionary("config")) {
        if (const std::string* path = config->findString(key)) return *path;
      }
    }
  }
  return fallback;
}

struct Command {
  std::string verb;  // "send" or "post"
  std::string configurationPath = kDefaultConfiguration;
  std::optional<std::string> socketPath;
  std::optional<std::string> plistPath;
  std::vector<std::string> names;  // send: TYPE; post: NAME OBJECT
  std::vector<std::string> pairs;
};

// Parses the command line; false on a usage error.
bool Parse(const std::vector<std::string>& args, Command& command) {
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    if ((arg == "-c" || arg == "--socket" || arg == "--plist") && i + 1 < args.size()) {
      const std::string& value = args[++i];
      if (arg == "-c") command.configurationPath = value;
      if (arg == "--socket") command.socketPath = value;
      if (arg == "--plist") command.plistPath = value;
    } else if (arg == "-c" || arg == "--socket" || arg == "--plist" || arg.starts_with("-")) {
      return false;
    } else if (command.verb.empty()) {
      if (arg != "send" && arg != "post" && arg != "stats" && arg != "status") return false;
      command.verb = arg;
    } else if (arg.find('=') == std::string::npos && command.pairs.empty()) {
      command.names.push_back(arg);
    } else if (arg.find('=') != std::string::npos && !command.plistPath) {
      command.pairs.push_back(arg);
    } else {
      return false;
    }
  }
  // Pairs only without --plist; post: NAME OBJECT and no socket; send: TYPE or --plist.
  if (command.plistPath && !command.pairs.empty()) return false;
  if (command.verb == "post") return command.names.size() == 2 && !command.socketPath;
  if (command.verb == "stats" || command.verb == "status") {
    return command.names.empty() && command.pairs.empty() && !command.plistPath;
  }
  return command.verb == "send" && command.names.size() == (command.plistPath ? 0u : 1u);
}

struct KeychainCommand {
  std::string configurationPath = kDefaultConfiguration;
  std::optional<std::string> storePath;
  std::string verb;
  std::vector<std::string> operands;  // SERVICE ACCOUNT
};

// Parses "keychain" command lines; false on a usage error.
bool ParseKeychain(const std::vector<std::string>& args, KeychainCommand& command) {
  bool sawKeychain = false;
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    if (arg == "-c" || arg == "--keychain") {
      if (i + 1 == args.size()) return false;
      (arg == "-c" ? command.configurationPath : command.storePath.emplace()) = args[++i];
    } else if (!sawKeychain) {
      if (arg != "keychain") return false;
      sawKeychain = true;
    } else if (command.verb.empty()) {
      command.verb = arg;
    } else {
      command.operands.push_back(arg);
    }
  }
  if (command.verb == "list") return command.operands.empty();
  if (command.verb == "set" || command.verb == "get" || command.verb == "delete") {
    return command.operands.size() == 2;
  }
  return false;
}

// The password from standard input: one line typed without echo on a terminal, else
// everything up to the end of the input. One trailing line break is not part of it.
std::optional<std::string> ReadPassword() {
  const bool terminal = isatty(STDIN_FILENO) == 1;
  termios saved{};
  if (terminal) {
    tcgetattr(STDIN_FILENO, &saved);
    termios quiet = saved;
    quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &quiet);
    std::fprintf(stderr, "Password: ");
  }
  std::string password;
  bool tooLong = false;
  char c;
  for (;;) {
    const ssize_t n = read(STDIN_FILENO, &c, 1);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0 || (terminal && c == '\n')) break;
    if (password.size() == kMaxPasswordBytes) {
      tooLong = true;
      break;
    }
    password.push_back(c);
  }
  if (terminal) {
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &saved);
    std::fputc('\n', stderr);
  }
  if (tooLong) return std::nullopt;
  if (password.ends_with('\n')) password.pop_back();
  if (password.ends_with('\r')) password.pop_back();
  return password;
}

// Text that an XML property list carries as a string: UTF-8 without control characters other
// than tab. Anything else is stored as data, which lookups decode the same way.
plist::Value PasswordValue(const std::string& password) {
  bool plain = plist::IsValidUtf8(password);
  for (const char c : password) {
    if (static_cast<unsigned char>(c) < 0x20 && c != '\t') plain = false;
  }
  if (plain) return plist::Value(password);
  return plist::Value::FromData(plist::Data(password.begin(), password.end()));
}

int RunKeychain(const KeychainCommand& command) {
  // The store is root's alone; anyone else could neither read it nor leave it root-only.
  if (geteuid() != 0) return Fail("keychain commands must be run as root");
  const std::string path = command.storePath
                               ? *command.storePath
                               : ConfigurationPath(command.configurationPath, "keychainPath",
                                                   tarvod::kDefaultKeychainPath);

  // A store the daemon would refuse is not edited either: its secrets may already be exposed,
  // and rewriting it would hide that.
  plist::Array items;
  tarvod::Result<tarvod::SecretFile> file = tarvod::ReadSecretFile(path);
  if (file.ok()) {
    std::optional<plist::Value> store = plist::ReadPropertyList(file.value().bytes);
    if (!store || !store->isArray()) return Fail(path + " is not a property-list array");
    items = std::move(store->array());
  } else if (file.status().error() != ENOENT) {
    return Fail(file.status().what());
  }

  if (command.verb == "list") {
    for (const plist::Value& item : items) {
      const plist::Dictionary* dictionary = item.asDictionary();
      const std::string* service = dictionary ? dictionary->findString("service") : nullptr;
      const std::string* account = dictionary ? dictionary->findString("account") : nullptr;
      if (service && account) std::printf("%s\t%s\n", service->c_str(), account->c_str());
    }
    return 0;
  }

  const std::string& service = command.operands[0];
  const std::string& account = command.operands[1];
  const std::optional<size_t> index = tarvod::FindKeychainItem(items, service, account);
  if (command.verb != "set" && !index) {
    return Fail("no item for service '" + service + "' and account '" + account + "'");
  }
  if (command.verb == "get") {
    const plist::Value* password = items[*index].asDictionary()->find("password");
    if (password && password->isString()) {
      std::printf("%s\n", password->string().c_str());
    } else if (password && password->isData()) {
      std::fwrite(password->data().data(), 1, password->data().size(), stdout);
      std::fputc('\n', stdout);
    } else {
      return Fail("the item's password is neither a string nor data");
    }
    return 0;
  }

  if (command.verb == "delete") {
    items.erase(items.begin() + static_cast<std::ptrdiff_t>(*index));
  } else {
    const std::optional<std::string> password = ReadPassword();
    if (!password) return Fail("the password is longer than 65536 bytes");
    if (password->empty()) return Fail("the password is empty");
    if (index) {
      items[*index].asDictionary()->set("password", PasswordValue(*password));
    } else {
      items.push_back(plist::Value(plist::Dictionary{{"service", plist::Value(service)},
                                                     {"account", plist::Value(account)},
                                                     {"password", PasswordValue(*password)}}));
    }
  }
  const std::optional<std::string> bytes = plist::WriteXmlPropertyList(plist::Value(items));
  if (!bytes) return Fail("the store cannot be written as a property list");
  tarvod::Files& files = tarvod::Files::Real();
  if (const size_t slash = path.rfind('/'); slash != std::string::npos && slash > 0) {
    files.makeDirectories(path.substr(0, slash), 0755);
  }
  // Written to a new 0600 file of root's, synced and renamed over the store: the daemon reads
  // the old store or the new one, never a part.
  const tarvod::Status written = files.writeAtomically(path, *bytes);
  if (!written.ok()) {
    return Fail("cannot write " + path + ": " + written.what() + ": " +
                std::strerror(written.error()));
  }
  return 0;
}

// Whether the first word after the options is "keychain".
bool IsKeychainCommand(const std::vector<std::string>& args) {
  for (size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "-c" || args[i] == "--keychain") {
      ++i;
      continue;
    }
    return args[i] == "keychain";
  }
  return false;
}

}  // namespace

int main(int argc, char** argv) {
  const std::vector<std::string> args(argv + 1, argv + argc);
  if (!args.empty() && (args[0] == "--help" || args[0] == "-h")) return Usage(stdout);
  if (args.size() == 1 && args[0] == "--version") {
    std::printf("tarvodctl %s\n", TARVOD_VERSION);
    return 0;
  }
  // check and test: -c may stand before or after the command word.
  for (size_t i = 0; i < args.size(); i += args[i] == "-c" ? 2 : 1) {
    if (args[i] == "-c") continue;
    if (args[i] != "check" && args[i] != "test") break;
    std::string configurationPath = kDefaultConfiguration;
    std::vector<std::string> rest;
    for (size_t j = 0; j < args.size(); ++j) {
      if (j == i) continue;
      if (args[j] == "-c" && j + 1 < args.size()) {
        configurationPath = args[++j];
      } else {
        rest.push_back(args[j]);
      }
    }
    const int status =
        args[i] == "check" ? RunCheck(rest, configurationPath) : RunTest(rest, configurationPath);
    return status == 2 ? Usage() : status;
  }
  if (IsKeychainCommand(args)) {
    KeychainCommand keychain;
    if (!ParseKeychain(args, keychain)) return Usage();
    return RunKeychain(keychain);
  }
  Command command;
  if (!Parse(args, command)) return Usage();
  if (command.verb == "stats" || command.verb == "status") {
    // Beside the event socket; root's alone.
    const std::string eventSocket =
        command.socketPath ? *command.socketPath
                           : ConfigurationPath(command.configurationPath, "eventSocketPath",
                                               tarvod::kDefaultEventSocketPath);
    std::string error;
    const std::optional<std::string> answer =
        tarvod::AskControlSocket(tarvod::ControlSocketPath(eventSocket), command.verb, &error);
    if (!answer) return Fail("no answer from tarvod: " + error);
    if (answer->starts_with("refused")) return Fail(*answer);
    std::fputs(answer->c_str(), stdout);
    return 0;
  }

  plist::Dictionary message;
  if (command.plistPath) {
    const auto file = plist::ReadPropertyListFile(*command.plistPath);
    if (!file) return Fail(*command.plistPath + " cannot be read as a property list");
    const plist::Dictionary* dictionary = file->asDictionary();
    if (dictionary == nullptr) return Fail(*command.plistPath + " is not a dictionary");
    message = *dictionary;
  } else {
    plist::Dictionary details;
    for (const std::string& pair : command.pairs) {
      const size_t equals = pair.find('=');
      details.set(pair.substr(0, equals), pair.substr(equals + 1));
    }
    message.set("eventType", command.names.back());
    message.set("eventDetails", std::move(details));
  }

  if (command.verb == "post") {
    const tarvod::Status posted = tarvod::SendNotification(
        tarvod::Notification{command.names[0], command.names[1], std::move(message)});
    if (!posted.ok()) return Fail("the notification was not posted: " + posted.what());
    return 0;
  }

  // Stamped as the daemon's own events are, in seconds since 2001, unless the sender did.
  if (!message.contains("eventTimestamp")) {
    message.set("eventTimestamp", plist::Value::Real(tarvod::Clock::System().now()));
  }
  const std::optional<std::string> bytes = plist::WriteXmlPropertyList(message);
  if (!bytes) return Fail("the message cannot be written as a property list");
  if (bytes->size() > tarvod::kMaxEventMessageBytes) {
    return Fail("the message is too large: " + std::to_string(bytes->size()) +
                " bytes, the daemon accepts at most " +
                std::to_string(tarvod::kMaxEventMessageBytes));
  }

  const std::string path = command.socketPath
                               ? *command.socketPath
                               : ConfigurationPath(command.configurationPath, "eventSocketPath",
                                                   tarvod::kDefaultEventSocketPath);
  const tarvod::SocketResult connection = tarvod::ConnectSeqpacket(path);
  if (connection.fd < 0) return Fail("tarvod is not listening: " + connection.error);
  std::string error;
  const bool sent = tarvod::SendPacket(connection.fd, *bytes, &error);
  close(connection.fd);
  if (!sent) return Fail("the event was not sent: " + error);
  return 0;
}
