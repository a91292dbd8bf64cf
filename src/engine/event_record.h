// The per-event record in the structured system log: the event's keys and details flattened
// into string attributes, the event time, whether rules existed and whether none fired.
// Records may be written from any thread; failures are logged and cost that record.
#pragma once

#include <memory>

#include "plist/value.h"

namespace tarvod {

// The records of one event: its attributes are gathered once, at the first write, and each
// write adds the flags of its prefix. The event must outlive the object.
class EventRecord {
 public:
  explicit EventRecord(const plist::Dictionary& event);
  ~EventRecord();
  EventRecord(const EventRecord&) = delete;
  EventRecord& operator=(const EventRecord&) = delete;

  void write(bool hasRules, bool eventBlocked);

 private:
  struct Attributes;
  static bool Gather(const plist::Dictionary& event, Attributes& attributes);

  const plist::Dictionary& mEvent;
  std::unique_ptr<Attributes> mAttributes;
};

// One record of an event.
void WriteEventRecord(const plist::Dictionary& event, bool hasRules, bool eventBlocked);

}  // namespace tarvod
