// tarvodctl: sends an event to a running tarvod over its event socket, or posts a
// distributed notification on the system bus.
//
//   tarvodctl [-c CONFIG] send [--socket PATH] TYPE [key=value ...]
//   tarvodctl [-c CONFIG] send [--socket PATH] --plist FILE
//   tarvodctl post NAME OBJECT [key=value ...]
//   tarvodctl post --plist FILE NAME OBJECT
//
// send with TYPE sends { eventType = TYPE; eventDetails = { key = value; ... }; }, with --plist
// the dictionary in a property-list file. Without --socket the path is the configuration
// file's eventSocketPath (default configuration /etc/tarvod.d/tarvod.plist), else the
// daemon's default. post posts the notification NAME with object OBJECT; its user information
// is { eventType = OBJECT; eventDetails = { key = value; ... }; }, the event the daemon's rules
// for OBJECT receive, or the dictionary in FILE. Exit status: 0 sent, 1 not sent, 2 usage.
#include <unistd.h>

#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/notification_center.h"
#include "platform/seqpacket.h"
#include "plist/codec.h"
#include "plist/value.h"
#include "sources/event_listener.h"

namespace {

constexpr const char* kDefaultConfiguration = "/etc/tarvod.d/tarvod.plist";

int Usage() {
  std::fprintf(stderr,
               "usage: tarvodctl [-c CONFIG] send [--socket PATH] TYPE [key=value ...]\n"
               "       tarvodctl [-c CONFIG] send [--socket PATH] --plist FILE\n"
               "       tarvodctl post NAME OBJECT [key=value ...]\n"
               "       tarvodctl post --plist FILE NAME OBJECT\n");
  return 2;
}

int Fail(const std::string& message) {
  std::fprintf(stderr, "tarvodctl: %s\n", message.c_str());
  return 1;
}

std::string SocketPathFromConfiguration(const std::string& configurationPath) {
  if (const auto file = plist::ReadPropertyListFile(configurationPath)) {
    if (const plist::Dictionary* root = file->asDictionary()) {
      if (const plist::Dictionary* config = root->findDictionary("config")) {
        if (const std::string* path = config->findString("eventSocketPath")) return *path;
      }
    }
  }
  return tarvod::kDefaultEventSocketPath;
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
      if (arg != "send" && arg != "post") return false;
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
  return command.verb == "send" && command.names.size() == (command.plistPath ? 0u : 1u);
}

}  // namespace

int main(int argc, char** argv) {
  Command command;
  if (!Parse(std::vector<std::string>(argv + 1, argv + argc), command)) return Usage();

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

  const std::optional<std::string> bytes = plist::WriteXmlPropertyList(message);
  if (!bytes) return Fail("the message cannot be written as a property list");
  if (bytes->size() > tarvod::kMaxEventMessageBytes) {
    return Fail("the message is too large: " + std::to_string(bytes->size()) +
                " bytes, the daemon accepts at most " +
                std::to_string(tarvod::kMaxEventMessageBytes));
  }

  const std::string path = command.socketPath
                               ? *command.socketPath
                               : SocketPathFromConfiguration(command.configurationPath);
  const tarvod::SocketResult connection = tarvod::ConnectSeqpacket(path);
  if (connection.fd < 0) return Fail("tarvod is not listening: " + connection.error);
  std::string error;
  const bool sent = tarvod::SendPacket(connection.fd, *bytes, &error);
  close(connection.fd);
  if (!sent) return Fail("the event was not sent: " + error);
  return 0;
}
