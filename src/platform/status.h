// The one failure type that crosses module boundaries: a Status is success or an error number
// with the text of the operation that failed; a Result<T> is a value or such a Status. errno
// becomes a Status only inside src/platform.
#pragma once

#include <optional>
#include <string>
#include <utility>

namespace tarvod {

class Status {
 public:
  static Status Ok() { return Status(); }
  // what names the failed operation ("rename state_temp"); error is the errno value.
  static Status Error(int error, std::string what) { return Status(error, std::move(what)); }

  bool ok() const { return mError == 0; }
  int error() const { return mError; }
  const std::string& what() const { return mWhat; }

 private:
  Status() = default;
  Status(int error, std::string what) : mError(error == 0 ? -1 : error), mWhat(std::move(what)) {}

  int mError = 0;
  std::string mWhat;
};

template <typename T>
class Result {
 public:
  Result(T value) : mValue(std::move(value)), mStatus(Status::Ok()) {}  // NOLINT: implicit
  Result(Status status) : mStatus(std::move(status)) {}                 // NOLINT: implicit

  bool ok() const { return mValue.has_value(); }
  const Status& status() const { return mStatus; }
  T& value() { return *mValue; }
  const T& value() const { return *mValue; }

 private:
  std::optional<T> mValue;
  Status mStatus;
};

}  // namespace tarvod
