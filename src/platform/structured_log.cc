#include "platform/structured_log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>

#include "platform/diagnostic_log.h"
#include "plist/value.h"
// The records carry the daemon's own fields only, not the source location of this file.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <memory>
#include <mutex>
#include <string>

namespace tarvod {
namespace {

// Journal fields the record itself writes, or that the journal reads with a meaning of its
// own. An attribute whose field name would be one of these gets the "A" prefix, so that an
// event key such as "message" can never replace the record's text or its priority.
constexpr std::array<std::string_view, 20> kReservedFields = {
    "MESSAGE",           "MESSAGE_ID",         "PRIORITY",
    "SYSLOG_IDENTIFIER", "SYSLOG_FACILITY",    "SYSLOG_PID",
    "SYSLOG_TIMESTAMP",  "SYSLOG_RAW",         "CODE_FILE",
    "CODE_LINE",         "CODE_FUNC",          "ERRNO",
    "INVOCATION_ID",     "USER_INVOCATION_ID", "UNIT",
    "USER_UNIT",         "DOCUMENTATION",      "TID",
    "OBJECT_PID",        "COREDUMP_UNIT",
};

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

// The journal takes field names of at most 64 characters.
constexpr size_t kMaxFieldName = 64;

bool JournalSocketPresent() {
  struct stat st {};
  return stat(kJournalSocket, &st) == 0 && S_ISSOCK(st.st_mode);
}

class JournalLog final : public StructuredLog {
 public:
  bool canDeliver() override { return JournalSocketPresent(); }

  bool sendAttributes(int priority, std::string_view message,
                      std::span<const LogAttributeView> attributes) override {
    std::vector<std::string> fields;
    fields.reserve(attributes.size() + 3);
    fields.push_back("SYSLOG_IDENTIFIER=tarvod");
    fields.push_back("PRIORITY=" + std::to_string(priority));
    fields.push_back("MESSAGE=" + std::string(message));
    for (const auto& [name, value] : attributes) {
      fields.push_back(JournalFieldName(name) + "=");
      fields.back() += value;
    }
    std::vector<iovec> vectors(fields.size());
    for (size_t i = 0; i < fields.size(); ++i) {
      vectors[i].iov_base = fields[i].data();
      vectors[i].iov_len = fields[i].size();
    }
    // sd_journal_sendv reports success when the journal's socket does not exist (it drops the
    // record silently); a record that cannot reach the journal must count as failed.
    if (!JournalSocketPresent()) return false;
    // sd_journal_sendv is safe to call from several threads at once.
    return sd_journal_sendv(vectors.data(), static_cast<int>(vectors.size())) >= 0;
  }
};

thread_local bool tHoldRecords = false;

// The file is kept open between records. Before the first record of each batch (a held batch,
// or each record of a thread that holds none) the path is looked up again: when it now names
// another file, or none, because the file was rotated or removed, the file is opened afresh.
class JsonLinesLog final : public StructuredLog {
 public:
  explicit JsonLinesLog(std::string path) : mPath(std::move(path)) {}
  ~JsonLinesLog() override {
    if (mFd >= 0) close(mFd);
  }

  bool sendAttributes(int priority, std::string_view message,
                      std::span<const LogAttributeView> attributes) override {
    return send(priority, message, attributes, nullptr);
  }
  bool sendAttributes(int priority, std::string_view message,
                      std::span<const LogAttributeView> attributes,
                      AttributeCache& cache) override {
    return send(priority, message, attributes, &cache);
  }

  void flush() override {
    std::lock_guard<std::mutex> guard(mLock);
    if (!mHeld.empty()) writeHeld();
  }

  void retire() override {
    std::lock_guard<std::mutex> guard(mLock);
    if (!mHeld.empty()) writeHeld();
    if (mFd >= 0) close(mFd);
    mFd = -1;
  }

 private:
  bool send(int priority, std::string_view message, std::span<const LogAttributeView> attributes,
            AttributeCache* cache) {
    // One lock around the descriptor and the held lines keeps lines whole and in order; the
    // line is made in place, after the lines held before it.
    std::lock_guard<std::mutex> guard(mLock);
    if (mHeld.empty() && !current()) return false;
    std::string& line = mHeld;
    line += "{\"identifier\": \"tarvod\", \"priority\": ";
    line += std::to_string(priority);
    line += ", \"message\": ";
    plist::AppendEscapedString(line, message);
    line += ", \"attributes\": {";
    size_t done = 0;
    if (cache != nullptr && cache->stable > 0 && cache->stable <= attributes.size()) {
      if (!cache->filled) {
        cache->text.clear();
        AppendAttributes(cache->text, attributes.first(cache->stable), true);
        cache->filled = true;
      }
      line += cache->text;
      done = cache->stable;
    }
    AppendAttributes(line, attributes.subspan(done), done == 0);
    line += "}}\n";
    ++mHeldRecords;
    if (!tHoldRecords || mHeld.size() >= kMaxHeldRecordBytes) return writeHeld();
    return true;
  }

  static void AppendAttributes(std::string& out, std::span<const LogAttributeView> attributes,
                               bool first) {
    for (const auto& [name, value] : attributes) {
      if (!first) out += ", ";
      first = false;
      plist::AppendEscapedString(out, name);
      out += ": ";
      plist::AppendEscapedString(out, value);
    }
  }

  // Makes mFd the file the path names now; false (and logged by the caller) when it cannot be
  // opened.
  bool current() {
    if (mFd >= 0) {
      struct stat named {};
      if (stat(mPath.c_str(), &named) == 0 && named.st_dev == mDevice && named.st_ino == mInode) {
        return true;
      }
      close(mFd);
      mFd = -1;
    }
    const int fd = OpenLogDestination(mPath.c_str(), O_CREAT | O_APPEND | O_NOFOLLOW, 0644);
    if (fd < 0) return false;
    struct stat opened {};
    if (fstat(fd, &opened) != 0) {
      close(fd);
      return false;
    }
    mFd = fd;
    mDevice = opened.st_dev;
    mInode = opened.st_ino;
    return true;
  }

  // Writes what is held; false when some of it was lost.
  bool writeHeld() {
    size_t written = 0;
    while (mFd >= 0 && written < mHeld.size()) {
      const ssize_t n = write(mFd, mHeld.data() + written, mHeld.size() - written);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      written += static_cast<size_t>(n);
    }
    const bool ok = written == mHeld.size();
    if (!ok) {
      const int error = errno;
      // Lines already out stay; the rest is dropped rather than retried into a half line.
      LogMessage(0, "Failed to write %zu event records to %s errno = %d", mHeldRecords,
                 mPath.c_str(), error);
    }
    mHeld.clear();
    mHeldRecords = 0;
    return ok;
  }

  const std::string mPath;
  std::mutex mLock;
  int mFd = -1;
  dev_t mDevice = 0;
  ino_t mInode = 0;
  std::string mHeld;
  size_t mHeldRecords = 0;
};

// Every sink ever made lives until the process ends, so a reference that DefaultStructuredLog
// returned stays valid on other threads after a reconfiguration.
std::mutex gSinkLock;
std::vector<std::unique_ptr<StructuredLog>> gSinks;
std::atomic<StructuredLog*> gCurrent{nullptr};

void Install(std::unique_ptr<StructuredLog> sink) {
  std::lock_guard<std::mutex> guard(gSinkLock);
  StructuredLog* replaced = gCurrent.exchange(sink.get());
  if (replaced) replaced->retire();
  gSinks.push_back(std::move(sink));
}

}  // namespace

std::string JournalFieldName(std::string_view attribute) {
  std::string field;
  field.reserve(attribute.size() + 1);
  for (const char c : attribute) {
    if (c >= 'a' && c <= 'z') {
      field += static_cast<char>(c - 'a' + 'A');
    } else if ((c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_') {
      field += c;
    } else {
      field += '_';
    }
  }
  bool prefix = field.empty() || field[0] == '_' || (field[0] >= '0' && field[0] <= '9');
  for (const std::string_view reserved : kReservedFields) {
    if (field == reserved) prefix = true;
  }
  if (prefix) field.insert(field.begin(), 'A');
  if (field.size() > kMaxFieldName) field.resize(kMaxFieldName);
  return field;
}

void ConfigureStructuredLog(const std::string& jsonLinesPath) {
  if (jsonLinesPath.empty()) {
    Install(std::make_unique<JournalLog>());
  } else {
    Install(std::make_unique<JsonLinesLog>(jsonLinesPath));
  }
}

void HoldStructuredLogRecordsOnThisThread() { tHoldRecords = true; }

void FlushStructuredLog() {
  if (StructuredLog* current = gCurrent.load()) current->flush();
}

StructuredLog& DefaultStructuredLog() {
  if (StructuredLog* current = gCurrent.load()) return *current;
  std::lock_guard<std::mutex> guard(gSinkLock);
  if (gCurrent.load() == nullptr) {
    gSinks.push_back(std::make_unique<JournalLog>());
    gCurrent.store(gSinks.back().get());
  }
  return *gCurrent.load();
}

}  // namespace tarvod
