// A received Notification signal: the input chooses the signal's argument types and values
// (any D-Bus type, nested to any depth), sd-bus builds and seals the message, and the reader
// turns it into a notification or refuses it.
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>

#include "fuzz_input.h"
#include "platform/notification_center.h"

namespace {

using tarvod::fuzz::ByteReader;

// Signatures deeper than this are refused by sd-bus itself; the reader's own bound is lower.
constexpr int kMaxDepth = 40;

// One complete type, chosen by the input.
std::string Signature(ByteReader& in, int depth) {
  static constexpr char kBasic[] = "ynqiuxtdbsogh";
  const uint8_t choice = in.byte();
  if (depth >= kMaxDepth || choice < 128) return std::string(1, kBasic[choice % 13]);
  switch (choice % 5) {
    case 0:
      return "v";
    case 1:
      return "a" + Signature(in, depth + 1);
    case 2:
      return std::string("a{") + kBasic[in.byte() % 13] + Signature(in, depth + 1) + "}";
    case 3:
      return "(d)";
    default: {
      std::string members = "(";
      for (int n = 1 + in.byte() % 3; n > 0; --n) members += Signature(in, depth + 1);
      return members + ")";
    }
  }
}

// Length of the complete type at the start of signature.
size_t TypeLength(const char* signature) {
  if (*signature == 'a') return 1 + TypeLength(signature + 1);
  if (*signature == '(' || *signature == '{') {
    const char close = *signature == '(' ? ')' : '}';
    size_t length = 1;
    while (signature[length] != close) length += TypeLength(signature + length);
    return length + 1;
  }
  return 1;
}

// Appends one value of the complete type at signature; false when sd-bus refuses it.
bool Append(sd_bus_message* m, const char* signature, ByteReader& in, int depth) {
  const char type = *signature;
  switch (type) {
    case 'y':
    case 'n':
    case 'q':
    case 'i':
    case 'u':
    case 'x':
    case 't':
    case 'b': {
      const uint64_t value = in.integer(8);
      return sd_bus_message_append_basic(m, type, &value) >= 0;
    }
    case 'd': {
      const uint64_t bits = in.integer(8);
      double value;
      std::memcpy(&value, &bits, sizeof value);
      return sd_bus_message_append_basic(m, type, &value) >= 0;
    }
    case 's':
    case 'o':
    case 'g': {
      const std::string text = in.text();
      return sd_bus_message_append_basic(m, type, text.c_str()) >= 0;
    }
    case 'h': {
      const int descriptor = 0;  // sd-bus duplicates it into the message
      return sd_bus_message_append_basic(m, type, &descriptor) >= 0;
    }
    case 'v': {
      const std::string contents = Signature(in, depth + 1);
      return sd_bus_message_open_container(m, 'v', contents.c_str()) >= 0 &&
             Append(m, contents.c_str(), in, depth + 1) && sd_bus_message_close_container(m) >= 0;
    }
    case 'a': {
      const std::string element(signature + 1, TypeLength(signature + 1));
      if (sd_bus_message_open_container(m, 'a', element.c_str()) < 0) return false;
      for (int n = in.byte() % 5; n > 0; --n) {
        if (!Append(m, element.c_str(), in, depth + 1)) return false;
      }
      return sd_bus_message_close_container(m) >= 0;
    }
    case '(':
    case '{': {
      const std::string contents(signature + 1, TypeLength(signature) - 2);
      if (sd_bus_message_open_container(m, type == '(' ? 'r' : 'e', contents.c_str()) < 0) {
        return false;
      }
      for (size_t at = 0; at < contents.size(); at += TypeLength(contents.c_str() + at)) {
        if (!Append(m, contents.c_str() + at, in, depth + 1)) return false;
      }
      return sd_bus_message_close_container(m) >= 0;
    }
    default:
      return false;
  }
}

// A connection that never reaches a bus: sd-bus builds messages only on an open one.
sd_bus* Bus() {
  int pair[2];
  sd_bus* bus = nullptr;
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, pair) < 0 ||
      sd_bus_new(&bus) < 0 || sd_bus_set_fd(bus, pair[0], pair[0]) < 0 ||
      sd_bus_set_anonymous(bus, 1) < 0 || sd_bus_negotiate_fds(bus, 1) < 0 ||
      sd_bus_start(bus) < 0) {
    std::abort();
  }
  return bus;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static sd_bus* bus = Bus();
  static uint64_t cookie = 0;
  ByteReader in(data, size);

  sd_bus_message* m = nullptr;
  if (sd_bus_message_new_signal(bus, &m, tarvod::kNotificationPath, tarvod::kNotificationInterface,
                                tarvod::kNotificationMember) < 0) {
    std::abort();
  }
  // Mostly the real arguments (name, object, user information), then whatever follows.
  std::string arguments = in.byte() < 200 ? "ssa{sv}" : "";
  for (int n = in.byte() % 3; n > 0; --n) arguments += Signature(in, 0);
  bool built = true;
  for (size_t at = 0; built && at < arguments.size(); at += TypeLength(arguments.c_str() + at)) {
    built = Append(m, arguments.c_str() + at, in, 0);
  }
  if (built && sd_bus_message_seal(m, ++cookie, 0) >= 0 && sd_bus_message_rewind(m, 1) >= 0) {
    tarvod::Result<tarvod::Notification> notification = tarvod::ReadNotification(m);
    if (notification.ok() && notification.value().userInfo) {
      tarvod::DescribeNotification(notification.value());
    }
  }
  sd_bus_message_unref(m);
  return 0;
}
