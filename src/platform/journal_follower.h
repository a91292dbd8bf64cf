// Follows the system journal for the entries of given programs run by root: the trusted
// fields _COMM and _UID, which journald sets itself, select them, so that no other user can
// forge one. Used on one thread (the input queue's).
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/status.h"

typedef struct sd_journal sd_journal;

namespace tarvod {

struct JournalEntry {
  std::string message;
  double timestamp = 0;  // seconds since 2001-01-01 UTC
  std::string cursor;
};

class JournalFollower {
 public:
  // Opens the local system journal, filtered to _UID=0 and one of commands, positioned after
  // the entry at cursor, or at the end when cursor is empty or unknown.
  static Result<std::unique_ptr<JournalFollower>> Open(const std::vector<std::string>& commands,
                                                       const std::string& cursor);
  ~JournalFollower();
  JournalFollower(const JournalFollower&) = delete;
  JournalFollower& operator=(const JournalFollower&) = delete;

  // Readable when new entries may have arrived; call readNew then.
  int descriptor() const { return mDescriptor; }
  // Up to limit entries that arrived since the last call; more may remain when limit came
  // back full.
  std::vector<JournalEntry> readNew(size_t limit);

 private:
  explicit JournalFollower(sd_journal* journal, int descriptor)
      : mJournal(journal), mDescriptor(descriptor) {}
  sd_journal* mJournal;
  int mDescriptor;
};

}  // namespace tarvod
