#include "daemon/companion_job.h"

#include "platform/diagnostic_log.h"
#include "platform/service_manager.h"

namespace tarvod {
namespace {

constexpr const char* kCompanionUnit = "com.quenta.tarvlog.service";
// Startup waits for the service manager at most this long per call.
constexpr double kServiceManagerSeconds = 10.0;

}  // namespace

void EnableCompanionLogJob() {
  const Status status = EnableAndStartUnit(kCompanionUnit, kServiceManagerSeconds);
  if (!status.ok()) LogMessage(2, "Enable tarvlog job failed %s", status.what().c_str());
}

}  // namespace tarvod
