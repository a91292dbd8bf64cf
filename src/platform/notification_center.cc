#include "platform/notification_center.h"

#include <sys/eventfd.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <limits>
#include <map>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/diagnostic_log.h"
#include "platform/main_loop.h"

namespace tarvod {
namespace {

constexpr const char* kDefaultSystemBus = "unix:path=/run/dbus/system_bus_socket";
constexpr double kConnectSeconds = 5.0;

std::string BusErrorText(int error) { return std::strerror(error < 0 ? -error : error); }

// A client connection to the system bus that accepts no descriptors: a sender cannot make
// the daemon hold open files.
Result<sd_bus*> OpenSystemBus(const char* description) {
  const char* address = std::getenv("DBUS_SYSTEM_BUS_ADDRESS");
  if (address == nullptr || *address == '\0') address = kDefaultSystemBus;
  sd_bus* bus = nullptr;
  int r = sd_bus_new(&bus);
  if (r >= 0) r = sd_bus_set_address(bus, address);
  if (r >= 0) r = sd_bus_set_bus_client(bus, 1);
  if (r >= 0) r = sd_bus_negotiate_fds(bus, 0);
  if (r >= 0) r = sd_bus_set_description(bus, description);
  if (r >= 0) r = sd_bus_start(bus);
  if (r < 0) {
    sd_bus_unref(bus);
    return Status::Error(
        -r, std::string("connect to the system bus at ") + address + ": " + BusErrorText(r));
  }
  return bus;
}

// Processes the connection until everything queued is written, for at most seconds.
bool FlushBus(sd_bus* bus, double seconds) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  for (;;) {
    const int processed = sd_bus_process(bus, nullptr);
    if (processed < 0) return false;
    if (processed > 0) continue;
    uint64_t queued = 0;
    if (sd_bus_is_ready(bus) > 0 && sd_bus_get_n_queued_write(bus, &queued) >= 0 && queued == 0) {
      return true;
    }
    const auto left = deadline - std::chrono::steady_clock::now();
    if (left <= std::chrono::steady_clock::duration::zero()) return false;
    if (sd_bus_wait(bus, static_cast<uint64_t>(
                             std::chrono::duration_cast<std::chrono::microseconds>(left).count())) <
        0) {
      return false;
    }
  }
}

// ---- Property-list values to D-Bus values ----

const char* SignatureOf(const plist::Value& value) {
  switch (value.kind()) {
    case plist::Value::Kind::kString:
      return "s";
    case plist::Value::Kind::kInteger:
      return "x";
    case plist::Value::Kind::kReal:
      return "d";
    case plist::Value::Kind::kBoolean:
      return "b";
    case plist::Value::Kind::kDate:
      return "(d)";
    case plist::Value::Kind::kData:
      return "ay";
    case plist::Value::Kind::kArray:
      return "av";
    case plist::Value::Kind::kDictionary:
      return "a{sv}";
  }
  return "s";
}

int AppendDictionary(sd_bus_message* m, const plist::Dictionary& dictionary);

int AppendVariant(sd_bus_message* m, const plist::Value& value) {
  const char* signature = SignatureOf(value);
  int r = sd_bus_message_open_container(m, 'v', signature);
  if (r < 0) return r;
  switch (value.kind()) {
    case plist::Value::Kind::kString:
      r = sd_bus_message_append_basic(m, 's', value.string().c_str());
      break;
    case plist::Value::Kind::kInteger: {
      const int64_t integer = value.integer();
      r = sd_bus_message_append_basic(m, 'x', &integer);
      break;
    }
    case plist::Value::Kind::kReal: {
      const double real = value.real();
      r = sd_bus_message_append_basic(m, 'd', &real);
      break;
    }
    case plist::Value::Kind::kBoolean: {
      const int boolean = value.boolean() ? 1 : 0;
      r = sd_bus_message_append_basic(m, 'b', &boolean);
      break;
    }
    case plist::Value::Kind::kDate:
      r = sd_bus_message_append(m, "(d)", value.date().secondsSince2001);
      break;
    case plist::Value::Kind::kData:
      r = sd_bus_message_append_array(m, 'y', value.data().data(), value.data().size());
      break;
    case plist::Value::Kind::kArray:
      r = sd_bus_message_open_container(m, 'a', "v");
      for (const plist::Value& element : value.array()) {
        if (r >= 0) r = AppendVariant(m, element);
      }
      if (r >= 0) r = sd_bus_message_close_container(m);
      break;
    case plist::Value::Kind::kDictionary:
      r = AppendDictionary(m, value.dictionary());
      break;
  }
  if (r < 0) return r;
  return sd_bus_message_close_container(m);
}

int AppendDictionary(sd_bus_message* m, const plist::Dictionary& dictionary) {
  int r = sd_bus_message_open_container(m, 'a', "{sv}");
  for (const auto& [key, value] : dictionary) {
    if (r >= 0) r = sd_bus_message_open_container(m, 'e', "sv");
    if (r >= 0) r = sd_bus_message_append_basic(m, 's', key.c_str());
    if (r >= 0) r = AppendVariant(m, value);
    if (r >= 0) r = sd_bus_message_close_container(m);
  }
  if (r < 0) return r;
  return sd_bus_message_close_container(m);
}

Status SendOn(sd_bus* bus, const Notification& notification) {
  sd_bus_message* m = nullptr;
  int r = sd_bus_message_new_signal(bus, &m, kNotificationPath, kNotificationInterface,
                                    kNotificationMember);
  if (r >= 0)
    r = sd_bus_message_append(m, "ss", notification.name.c_str(), notification.object.c_str());
  if (r >= 0 && notification.userInfo) r = AppendDictionary(m, *notification.userInfo);
  if (r >= 0) r = sd_bus_send(bus, m, nullptr);
  sd_bus_message_unref(m);
  if (r < 0) return Status::Error(-r, "post " + notification.name + ": " + BusErrorText(r));
  return Status::Ok();
}

// ---- D-Bus values to property-list values, bounded ----

class Reader {
 public:
  explicit Reader(sd_bus_message* m) : mMessage(m) {}
  const std::string& error() const { return mError; }

  std::optional<plist::Dictionary> dictionary(const char* contents, int depth) {
    if (!enter(depth)) return std::nullopt;
    if (contents[1] != 's' && contents[1] != 'o' && contents[1] != 'g') {
      return fail(std::string("a dictionary with keys of type ") + contents[1]);
    }
    const std::string entry(contents + 1, std::strlen(contents) - 2);  // "{sv}" -> "sv"
    if (sd_bus_message_enter_container(mMessage, 'a', contents) <= 0) return fail("bad array");
    std::vector<plist::Dictionary::Entry> entries;
    for (;;) {
      const int r = sd_bus_message_enter_container(mMessage, 'e', entry.c_str());
      if (r < 0) return fail("bad dictionary entry");
      if (r == 0) break;
      const char* key = nullptr;
      if (sd_bus_message_read_basic(mMessage, contents[1], &key) <= 0 || !charge(key)) {
        return fail(mError.empty() ? "bad dictionary key" : mError);
      }
      std::optional<plist::Value> value = read(depth + 1);
      if (!value) return std::nullopt;
      entries.emplace_back(key, std::move(*value));
      if (sd_bus_message_exit_container(mMessage) < 0) return fail("bad dictionary entry");
    }
    if (sd_bus_message_exit_container(mMessage) < 0) return fail("bad array");
    return plist::Dictionary::FromEntries(std::move(entries));
  }

 private:
  std::optional<plist::Value> read(int depth) {
    char type = 0;
    const char* contents = nullptr;
    if (sd_bus_message_peek_type(mMessage, &type, &contents) <= 0) return fail("missing value");
    if (!charge(nullptr)) return std::nullopt;
    switch (type) {
      case 'y':
        return integer<uint8_t>(type);
      case 'n':
        return integer<int16_t>(type);
      case 'q':
        return integer<uint16_t>(type);
      case 'i':
        return integer<int32_t>(type);
      case 'u':
        return integer<uint32_t>(type);
      case 'x':
        return integer<int64_t>(type);
      case 't': {
        uint64_t value = 0;
        if (sd_bus_message_read_basic(mMessage, type, &value) <= 0) return fail("bad number");
        if (value > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
          return plist::Value::Real(static_cast<double>(value));
        }
        return plist::Value::Integer(static_cast<int64_t>(value));
      }
      case 'd': {
        double value = 0;
        if (sd_bus_message_read_basic(mMessage, type, &value) <= 0) return fail("bad number");
        return plist::Value::Real(value);
      }
      case 'b': {
        int value = 0;
        if (sd_bus_message_read_basic(mMessage, type, &value) <= 0) return fail("bad boolean");
        return plist::Value::Boolean(value != 0);
      }
      case 's':
      case 'o':
      case 'g': {
        const char* text = nullptr;
        if (sd_bus_message_read_basic(mMessage, type, &text) <= 0) return fail("bad string");
        if (!charge(text)) return std::nullopt;
        return plist::Value(std::string(text));
      }
      case 'v': {
        if (!enter(depth) || sd_bus_message_enter_container(mMessage, 'v', contents) <= 0) {
          return fail(mError.empty() ? "bad variant" : mError);
        }
        std::optional<plist::Value> value = read(depth + 1);
        if (!value) return std::nullopt;
        if (sd_bus_message_exit_container(mMessage) < 0) return fail("bad variant");
        return value;
      }
      case 'a':
        if (contents[0] == 'y') {
          const void* bytes = nullptr;
          size_t size = 0;
          if (sd_bus_message_read_array(mMessage, 'y', &bytes, &size) < 0) return fail("bad data");
          if (!charge(nullptr, size)) return std::nullopt;
          const auto* begin = static_cast<const uint8_t*>(bytes);
          return plist::Value::FromData(plist::Data(begin, begin + size));
        }
        if (contents[0] == '{') {
          std::optional<plist::Dictionary> dictionary = this->dictionary(contents, depth);
          if (!dictionary) return std::nullopt;
          return plist::Value(std::move(*dictionary));
        }
        return sequence('a', contents, depth);
      case 'r':
        if (std::strcmp(contents, "d") == 0) {
          double seconds = 0;
          if (sd_bus_message_read(mMessage, "(d)", &seconds) <= 0) return fail("bad date");
          return plist::Value::FromDate(plist::Date{seconds});
        }
        return sequence('r', contents, depth);
      default:
        return fail(std::string("a value of type ") + type);
    }
  }

  // An array, or a struct other than a date: an array of its members.
  std::optional<plist::Value> sequence(char type, const char* contents, int depth) {
    if (!enter(depth) || sd_bus_message_enter_container(mMessage, type, contents) <= 0) {
      return fail(mError.empty() ? "bad container" : mError);
    }
    plist::Array array;
    while (sd_bus_message_at_end(mMessage, 0) == 0) {
      std::optional<plist::Value> value = read(depth + 1);
      if (!value) return std::nullopt;
      array.push_back(std::move(*value));
    }
    if (sd_bus_message_exit_container(mMessage) < 0) return fail("bad container");
    return plist::Value(std::move(array));
  }

  template <typename T>
  std::optional<plist::Value> integer(char type) {
    T value{};
    if (sd_bus_message_read_basic(mMessage, type, &value) <= 0) return fail("bad number");
    return plist::Value::Integer(static_cast<int64_t>(value));
  }

  bool enter(int depth) {
    if (depth < kMaxNotificationDepth) return true;
    fail("nested deeper than " + std::to_string(kMaxNotificationDepth) + " containers");
    return false;
  }

  bool charge(const char* text, size_t bytes = 0) {
    mBytes += 8 + bytes + (text ? std::strlen(text) : 0);
    if (mBytes <= kMaxNotificationBytes) return true;
    fail("larger than " + std::to_string(kMaxNotificationBytes) + " bytes");
    return false;
  }

  std::nullopt_t fail(std::string why) {
    if (mError.empty()) mError = std::move(why);
    return std::nullopt;
  }

  sd_bus_message* mMessage;
  size_t mBytes = 0;
  std::string mError;
};

}  // namespace

Result<Notification> ReadNotification(sd_bus_message* m) {
  const char* signature = sd_bus_message_get_signature(m, 1);
  const bool withUserInfo = signature && std::strcmp(signature, "ssa{sv}") == 0;
  if (!withUserInfo && !(signature && std::strcmp(signature, "ss") == 0)) {
    return Status::Error(
        EBADMSG, std::string("arguments (") + (signature ? signature : "") + ") are not (ssa{sv})");
  }
  const char* name = nullptr;
  const char* object = nullptr;
  if (sd_bus_message_read(m, "ss", &name, &object) <= 0) {
    return Status::Error(EBADMSG, "unreadable name and object");
  }
  Notification notification{name, object, std::nullopt};
  if (withUserInfo) {
    Reader reader(m);
    notification.userInfo = reader.dictionary("{sv}", 0);
    if (!notification.userInfo) return Status::Error(EBADMSG, "user information " + reader.error());
  }
  return notification;
}

namespace {

std::string MatchRule(const std::string* object) {
  std::string rule = std::string("type='signal',path='") + kNotificationPath + "',interface='" +
                     kNotificationInterface + "',member='" + kNotificationMember + "'";
  if (object) rule += ",arg1='" + *object + "'";
  return rule;
}

class BusNotificationCenter final : public NotificationCenter {
 public:
  // The descriptor exists before any thread can post.
  BusNotificationCenter() : mPostFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}
  ~BusNotificationCenter() override {
    for (auto& [object, observation] : mObservations) sd_bus_slot_unref(observation.slot);
    sd_bus_slot_unref(mHoldSlot);
    sd_event_source_disable_unref(mPostSource);
    if (mPostFd >= 0) close(mPostFd);
    sd_bus_flush_close_unref(mBus);
  }
  BusNotificationCenter(const BusNotificationCenter&) = delete;
  BusNotificationCenter& operator=(const BusNotificationCenter&) = delete;

  Status attach(MainLoop& loop) override {
    if (!loop.event()) return Status::Error(ENXIO, "no main loop");
    if (!mPostSource &&
        (mPostFd < 0 || sd_event_add_io(loop.event(), &mPostSource, mPostFd, EPOLLIN,
                                        &BusNotificationCenter::OnPosts, this) < 0)) {
      return Status::Error(EBADF, "no descriptor for posts");
    }
    if (mBus) return Status::Ok();
    Result<sd_bus*> bus = OpenSystemBus("tarvod-notifications");
    if (!bus.ok()) return bus.status();
    mBus = bus.value();
    const int r = sd_bus_attach_event(mBus, loop.event(), SD_EVENT_PRIORITY_NORMAL);
    if (r < 0) return Status::Error(-r, "attach the bus to the main loop: " + BusErrorText(r));
    // Posts made before the connection existed go out with the first turn of the loop.
    const uint64_t one = 1;
    (void)!write(mPostFd, &one, sizeof one);
    return Status::Ok();
  }

  Status addObserver(const void* owner, const std::string& object, Observer observer) override {
    auto found = mObservations.find(object);
    if (found == mObservations.end()) {
      if (!mBus) return Status::Error(ENOTCONN, "no connection to the system bus");
      // A match rule quotes its values with apostrophes and cannot carry one or a backslash.
      if (object.find_first_of("'\\") != std::string::npos) {
        return Status::Error(EINVAL, "an object with an apostrophe or backslash");
      }
      sd_bus_slot* slot = nullptr;
      const int r = sd_bus_add_match(mBus, &slot, MatchRule(&object).c_str(),
                                     &BusNotificationCenter::OnSignal, this);
      if (r < 0) return Status::Error(-r, "add match: " + BusErrorText(r));
      found = mObservations.emplace(object, Observation{slot, {}}).first;
    }
    for (auto& [existing, callback] : found->second.observers) {
      if (existing == owner) {
        callback = std::move(observer);
        return Status::Ok();
      }
    }
    found->second.observers.emplace_back(owner, std::move(observer));
    return Status::Ok();
  }

  void removeObserver(const void* owner, const std::string& object) override {
    auto found = mObservations.find(object);
    if (found == mObservations.end()) return;
    std::erase_if(found->second.observers, [owner](const auto& o) { return o.first == owner; });
    if (!found->second.observers.empty()) return;
    sd_bus_slot_unref(found->second.slot);
    mObservations.erase(found);
  }

  Status post(Notification notification) override {
    {
      std::lock_guard<std::mutex> lock(mPostLock);
      if (mPosts.size() >= kMaxPendingPosts) {
        return Status::Error(ENOBUFS, std::to_string(kMaxPendingPosts) +
                                          " notifications are already waiting to be posted");
      }
      mPosts.push_back(std::move(notification));
    }
    if (mPostFd >= 0) {
      const uint64_t one = 1;
      (void)!write(mPostFd, &one, sizeof one);
    }
    return Status::Ok();
  }

  void suspend() override {
    if (mSuspended) return;
    mSuspended = true;
    // While observations are removed and added again, one match for every notification keeps
    // the bus sending them, so that none posted meanwhile is lost.
    if (mBus && !mHoldSlot) {
      const int r = sd_bus_add_match(mBus, &mHoldSlot, MatchRule(nullptr).c_str(),
                                     &BusNotificationCenter::OnSignal, this);
      if (r < 0)
        LogMessage(1, "NotificationCenter: cannot hold notifications: %s", BusErrorText(r).c_str());
    }
  }

  void resume() override {
    if (!mSuspended) return;
    // sd-bus gives a match only the messages read after the bus confirmed it, so what was read
    // while the new observations were being added (during their own AddMatch calls) reaches
    // the hold match alone: take it in now, while still held.
    for (size_t i = 0; mBus && i < kMaxHeldNotifications && sd_bus_process(mBus, nullptr) > 0;
         ++i) {
    }
    mSuspended = false;
    std::deque<Notification> held;
    held.swap(mHeld);
    for (const Notification& notification : held) deliver(notification);
    // What the bus sent for the hold match and is still unread finds the observations now in
    // place, or nothing.
    mHoldSlot = sd_bus_slot_unref(mHoldSlot);
  }

  void flush(double seconds) override {
    sendPosts();
    if (mBus) FlushBus(mBus, seconds);
  }

 private:
  struct Observation {
    sd_bus_slot* slot = nullptr;
    std::vector<std::pair<const void*, Observer>> observers;
  };

  static int OnSignal(sd_bus_message* m, void* self, sd_bus_error*) {
    static_cast<BusNotificationCenter*>(self)->receive(m);
    return 1;  // handled: a notification that several matches fit is delivered once
  }

  static int OnPosts(sd_event_source*, int fd, uint32_t, void* self) {
    uint64_t count = 0;
    (void)!read(fd, &count, sizeof count);
    static_cast<BusNotificationCenter*>(self)->sendPosts();
    return 0;
  }

  void receive(sd_bus_message* m) {
    Result<Notification> notification = ReadNotification(m);
    if (!notification.ok()) {
      const char* sender = sd_bus_message_get_sender(m);
      LogMessage(2, "NotificationCenter: refused a notification from %s: %s",
                 sender ? sender : "(unknown)", notification.status().what().c_str());
      return;
    }
    if (!mSuspended) {
      deliver(notification.value());
    } else if (mHeld.size() < kMaxHeldNotifications) {
      mHeld.push_back(std::move(notification.value()));
    } else {
      LogMessage(1, "NotificationCenter: %zu notifications held; dropped %s for %s", mHeld.size(),
                 notification.value().name.c_str(), notification.value().object.c_str());
    }
  }

  void deliver(const Notification& notification) {
    auto found = mObservations.find(notification.object);
    if (found == mObservations.end()) return;
    // An observer may change the observations; it works on a copy of the list.
    const auto observers = found->second.observers;
    for (const auto& [owner, observer] : observers) observer(notification);
  }

  void sendPosts() {
    std::deque<Notification> posts;
    {
      std::lock_guard<std::mutex> lock(mPostLock);
      posts.swap(mPosts);
    }
    for (const Notification& notification : posts) {
      const Status sent = mBus ? SendOn(mBus, notification)
                               : Status::Error(ENOTCONN, "no connection to the system bus");
      if (!sent.ok()) {
        LogMessage(1, "NotificationCenter: %s for %s not posted: %s", notification.name.c_str(),
                   notification.object.c_str(), sent.what().c_str());
      }
    }
  }

  sd_bus* mBus = nullptr;
  std::map<std::string, Observation> mObservations;
  bool mSuspended = false;
  sd_bus_slot* mHoldSlot = nullptr;
  std::deque<Notification> mHeld;

  const int mPostFd;
  sd_event_source* mPostSource = nullptr;
  std::mutex mPostLock;
  std::deque<Notification> mPosts;  // guarded by mPostLock
};

}  // namespace

std::string DescribeNotification(const Notification& notification) {
  plist::Dictionary description{{"name", plist::Value(notification.name)},
                                {"object", plist::Value(notification.object)}};
  if (notification.userInfo) description.set("userInfo", plist::Value(*notification.userInfo));
  return plist::Describe(description);
}

NotificationCenter& NotificationCenter::Default() {
  // Never destroyed: jobs still running at exit may post into it.
  static auto* center = new BusNotificationCenter();
  return *center;
}

std::unique_ptr<NotificationCenter> NotificationCenter::Create() {
  return std::make_unique<BusNotificationCenter>();
}

Status SendNotification(const Notification& notification) {
  Result<sd_bus*> bus = OpenSystemBus("tarvodctl");
  if (!bus.ok()) return bus.status();
  Status sent = SendOn(bus.value(), notification);
  if (sent.ok() && !FlushBus(bus.value(), kConnectSeconds)) {
    sent = Status::Error(ETIMEDOUT, "the bus did not take the notification");
  }
  sd_bus_flush_close_unref(bus.value());
  return sent;
}

}  // namespace tarvod
