// Distributed notifications: any process posts a notification (a name, an object and
// optional user information) and every observer of that object receives it. On Linux a
// notification is the D-Bus signal Notification(s name, s object, a{sv} userInfo) on the
// system bus (DBUS_SYSTEM_BUS_ADDRESS when set), path /com/quenta/DistributedNotifications,
// interface com.quenta.DistributedNotifications; observing an object is a match rule on the
// signal's second argument.
//
// Property-list values travel as D-Bus values: string s, integer x, real d, boolean b, data
// ay, array av, dictionary a{sv}, and a date as the struct (d) holding its seconds since
// 2001-01-01 00:00:00 UTC. Received, the other integer types read as integers (t above the
// 64-bit signed range as a real), o and g as strings, other structs as arrays; a dictionary
// needs string keys and unix descriptors are refused. A received notification whose user
// information nests deeper than kMaxNotificationDepth containers or holds more than
// kMaxNotificationBytes is refused with a message and never delivered; so is a signal whose
// arguments are not (ss) or (ssa{sv}). (ss) is a notification without user information.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/status.h"
#include "plist/value.h"

typedef struct sd_bus_message sd_bus_message;

namespace tarvod {

class MainLoop;

inline constexpr const char* kNotificationPath = "/com/quenta/DistributedNotifications";
inline constexpr const char* kNotificationInterface = "com.quenta.DistributedNotifications";
inline constexpr const char* kNotificationMember = "Notification";
// Counted as the bytes of every string, key and data value plus 8 per value.
inline constexpr size_t kMaxNotificationBytes = 1024 * 1024;
// Nested D-Bus containers (arrays, dictionaries, variants, structs) inside the user
// information: a dictionary in a dictionary takes two, one for the variant.
inline constexpr int kMaxNotificationDepth = 32;
// Notifications received while suspended, and posts not yet handed to the bus; beyond these
// the newest are dropped with a message.
inline constexpr size_t kMaxHeldNotifications = 4096;
inline constexpr size_t kMaxPendingPosts = 4096;

struct Notification {
  std::string name;
  std::string object;
  std::optional<plist::Dictionary> userInfo;  // nullopt: the notification carries none
};

// "name = N; object = O; userInfo = { ... }", the notification's text form in messages.
std::string DescribeNotification(const Notification& notification);

class NotificationCenter {
 public:
  using Observer = std::function<void(const Notification&)>;
  virtual ~NotificationCenter() = default;

  // Main thread. Connects to the bus and delivers on loop from now on. On failure the center
  // observes nothing and drops what is posted; the Status says why.
  virtual Status attach(MainLoop& loop) = 0;
  // Main thread. Delivers the notifications whose object is `object` to observer, on the main
  // thread; replaces an earlier observation of the same owner and object.
  virtual Status addObserver(const void* owner, const std::string& object, Observer observer) = 0;
  // Main thread. Harmless when there is no such observation.
  virtual void removeObserver(const void* owner, const std::string& object) = 0;
  // Any thread. Hands the notification to the main loop for posting and returns at once; it
  // never waits for the bus or for receivers. An error when too many posts wait.
  virtual Status post(Notification notification) = 0;
  // Main thread. While suspended, received notifications are held in order, including those
  // for objects whose observation is removed and added again meanwhile; resume delivers them
  // to the observations then in place.
  virtual void suspend() = 0;
  virtual void resume() = 0;
  // Main thread. Sends what was posted and waits up to seconds for the bus to take it.
  virtual void flush(double seconds) = 0;

  // The process's center on the system bus; lives as long as the process.
  static NotificationCenter& Default();
  // A center of its own on the system bus (tests).
  static std::unique_ptr<NotificationCenter> Create();
};

// The arguments of a received Notification signal, bounded as above; an error says why the
// message is refused.
Result<Notification> ReadNotification(sd_bus_message* m);

// Sends one notification on a connection of its own to the system bus and waits until the
// bus has taken it (for tools; the daemon posts through its center).
Status SendNotification(const Notification& notification);

}  // namespace tarvod
