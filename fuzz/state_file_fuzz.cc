// The saved-state file: any bytes as "state", restored into the variable store as at startup,
// then saved and restored again. What the daemon saves it must read back unchanged, or a
// restart would lose variables.
#include <fcntl.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "daemon/state.h"
#include "platform/diagnostic_log.h"
#include "platform/testing/fake_clock.h"
#include "platform/testing/fake_files.h"
#include "plist_round_trip.h"

namespace {

const plist::Dictionary kConfiguration{{"saveState", plist::Value::Boolean(true)},
                                       {"stateDirectory", "/state"}};

plist::Value Snapshot(tarvod::Engine& engine) {
  plist::Value copy;
  engine.withVariables([&](tarvod::VariableStore& store) { copy = plist::Value(store); });
  return copy;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const bool quiet = [] {
    const int fd = open("/dev/null", O_WRONLY | O_APPEND | O_CLOEXEC);
    if (fd >= 0) tarvod::AttachErrorLog(fd);
    return true;
  }();
  (void)quiet;
  static tarvod::FakeClock clock(0);
  // One engine for every input: each starts a processing thread.
  static tarvod::Engine engine(clock, {});
  engine.withVariables([](tarvod::VariableStore& store) { store = tarvod::VariableStore(); });

  tarvod::FakeFiles files;
  files.files["/state/state"] = std::string(reinterpret_cast<const char*>(data), size);
  tarvod::RestoreState(kConfiguration, engine, files);
  const plist::Value restored = Snapshot(engine);

  files.files.clear();
  tarvod::SaveState(kConfiguration, engine, files);
  if (!files.exists("/state/state")) tarvod::fuzz::Fail("restored state not saved", restored);
  engine.withVariables([](tarvod::VariableStore& store) { store = tarvod::VariableStore(); });
  tarvod::RestoreState(kConfiguration, engine, files);
  // Saved as XML, which holds dates to the whole second.
  if (!(Snapshot(engine) == tarvod::fuzz::WholeSeconds(restored))) {
    tarvod::fuzz::Fail("saved state reads back as another value", restored);
  }
  return 0;
}
