#include "sources/monitor_engine.h"

namespace tarvod {

MonitorHooks EngineHooks(Engine& engine) {
  SerialQueue& queue = engine.queue();
  return MonitorHooks{
      [&engine](plist::Dictionary&& event) { engine.dispatchEvent(std::move(event)); },
      [&queue] { return queue.pending(); },
      [&queue](size_t limit) { queue.signalWhenPendingAtMost(limit); },
      queue.progressDescriptor(),
  };
}

}  // namespace tarvod
