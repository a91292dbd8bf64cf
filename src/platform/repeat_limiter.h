// Keeps a flood of one log line from filling the disk: the first line with a given text is
// written, the same text again within the interval after it is only counted, and when the
// interval ends one summary line reports the count. Lines of different texts are never counted
// together. Not thread-safe: the owner serialises every call (the error log holds its lock).
#pragma once

#include <cstddef>
#include <cstdint>
#include <list>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/clock.h"

namespace tarvod {

inline constexpr double kDefaultLogRepeatInterval = 10.0;
// Texts followed at once. When a new text comes and all are in use, the oldest window ends
// early (with its summary), so memory stays bounded whatever the daemon logs.
inline constexpr size_t kMaxRepeatKeys = 1024;

class RepeatLimiter {
 public:
  // clock must outlive the limiter. An interval of 0 or less turns the limit off.
  RepeatLimiter(const Clock& clock, double intervalSeconds, size_t maxKeys = kMaxRepeatKeys);
  RepeatLimiter(const RepeatLimiter&) = delete;
  RepeatLimiter& operator=(const RepeatLimiter&) = delete;

  // Applies to the windows already open as well.
  void setInterval(double seconds) { mInterval = seconds; }
  double interval() const { return mInterval; }

  // True when a line with this text is to be written; false when it repeats a text written less
  // than the interval ago and was counted instead. Summary lines of the windows that had ended
  // are appended to summaries first; they belong in the log before this text.
  bool admit(std::string_view text, std::vector<std::string>& summaries);
  // Appends the summary lines of the windows that have ended, and forgets their texts.
  void collectEnded(std::vector<std::string>& summaries);
  // Ends every window now (the log is closing): appends their summary lines.
  void collectAll(std::vector<std::string>& summaries);
  // When the earliest open window ends, in the clock's seconds; nullopt when none is open.
  std::optional<double> nextEnd() const;

 private:
  struct Window {
    std::string text;
    double start = 0;
    uint64_t repeats = 0;
  };
  // Removes the oldest window, appending its summary when it counted repeats.
  void close(std::vector<std::string>& summaries);
  void collectEndedAt(double now, std::vector<std::string>& summaries);

  const Clock& mClock;
  double mInterval;
  const size_t mMaxKeys;
  // Open windows in the order they opened, which is also the order in which they end.
  std::list<Window> mWindows;
  // Each open window by its text; the key views the text held in the list node.
  std::unordered_map<std::string_view, std::list<Window>::iterator> mByText;
};

}  // namespace tarvod
