#include "platform/journal_follower.h"

#include <systemd/sd-journal.h>

#include <cstring>

#include "plist/value.h"

namespace tarvod {
namespace {

// A field's value, without its "NAME=" prefix; empty when absent.
std::string Field(sd_journal* journal, const char* name) {
  const void* data = nullptr;
  size_t length = 0;
  if (sd_journal_get_data(journal, name, &data, &length) < 0) return {};
  const size_t prefix = std::strlen(name) + 1;
  if (length < prefix) return {};
  return std::string(static_cast<const char*>(data) + prefix, length - prefix);
}

}  // namespace

Result<std::unique_ptr<JournalFollower>> JournalFollower::Open(
    const std::vector<std::string>& commands, const std::string& cursor) {
  sd_journal* journal = nullptr;
  int result = sd_journal_open(&journal, SD_JOURNAL_LOCAL_ONLY | SD_JOURNAL_SYSTEM);
  if (result < 0) return Status::Error(-result, "sd_journal_open");
  // Matches on one field are alternatives; the _UID match must hold as well.
  for (const std::string& command : commands) {
    const std::string match = "_COMM=" + command;
    if ((result = sd_journal_add_match(journal, match.data(), match.size())) < 0) break;
  }
  if (result >= 0) result = sd_journal_add_match(journal, "_UID=0", 0);
  if (result < 0) {
    sd_journal_close(journal);
    return Status::Error(-result, "sd_journal_add_match");
  }
  bool positioned = false;
  if (!cursor.empty() && sd_journal_seek_cursor(journal, cursor.c_str()) >= 0 &&
      sd_journal_next(journal) > 0 && sd_journal_test_cursor(journal, cursor.c_str()) > 0) {
    positioned = true;  // on the entry read last: the next one is new
  }
  if (!positioned) {
    sd_journal_seek_tail(journal);
    sd_journal_previous(journal);
  }
  const int descriptor = sd_journal_get_fd(journal);
  if (descriptor < 0) {
    sd_journal_close(journal);
    return Status::Error(-descriptor, "sd_journal_get_fd");
  }
  return std::unique_ptr<JournalFollower>(new JournalFollower(journal, descriptor));
}

JournalFollower::~JournalFollower() { sd_journal_close(mJournal); }

std::vector<JournalEntry> JournalFollower::readNew(size_t limit) {
  sd_journal_process(mJournal);
  std::vector<JournalEntry> entries;
  while (entries.size() < limit && sd_journal_next(mJournal) > 0) {
    JournalEntry entry;
    entry.message = Field(mJournal, "MESSAGE");
    uint64_t microseconds = 0;
    if (sd_journal_get_realtime_usec(mJournal, &microseconds) >= 0) {
      entry.timestamp = static_cast<double>(microseconds) / 1e6 - plist::kUnixTimeOfReferenceDate;
    }
    char* cursor = nullptr;
    if (sd_journal_get_cursor(mJournal, &cursor) >= 0) {
      entry.cursor = cursor;
      free(cursor);
    }
    entries.push_back(std::move(entry));
  }
  return entries;
}

}  // namespace tarvod
