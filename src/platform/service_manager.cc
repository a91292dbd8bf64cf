#include "platform/service_manager.h"

#include <systemd/sd-bus.h>

#include <cstring>

namespace tarvod {
namespace {

constexpr const char* kManager = "org.freedesktop.systemd1";
constexpr const char* kManagerPath = "/org/freedesktop/systemd1";
constexpr const char* kManagerInterface = "org.freedesktop.systemd1.Manager";

Status BusFailure(int r, const sd_bus_error& error) {
  if (error.message && *error.message) return Status::Error(-r, error.message);
  if (error.name) return Status::Error(-r, error.name);
  return Status::Error(-r, std::strerror(-r));
}

}  // namespace

Status EnableAndStartUnit(const std::string& unit, double timeoutSeconds) {
  sd_bus* bus = nullptr;
  int r = sd_bus_open_system(&bus);
  if (r < 0) return Status::Error(-r, std::strerror(-r));
  const auto timeout = static_cast<uint64_t>(timeoutSeconds * 1e6);

  sd_bus_error error = SD_BUS_ERROR_NULL;
  sd_bus_message* call = nullptr;
  sd_bus_message* reply = nullptr;
  // EnableUnitFiles(as files, b runtime, b force), then StartUnit(s name, s mode).
  r = sd_bus_message_new_method_call(bus, &call, kManager, kManagerPath, kManagerInterface,
                                     "EnableUnitFiles");
  if (r >= 0) r = sd_bus_message_append(call, "asbb", 1, unit.c_str(), 0, 0);
  if (r >= 0) r = sd_bus_call(bus, call, timeout, &error, &reply);
  call = sd_bus_message_unref(call);
  reply = sd_bus_message_unref(reply);
  if (r >= 0) {
    r = sd_bus_message_new_method_call(bus, &call, kManager, kManagerPath, kManagerInterface,
                                       "StartUnit");
    if (r >= 0) r = sd_bus_message_append(call, "ss", unit.c_str(), "replace");
    if (r >= 0) r = sd_bus_call(bus, call, timeout, &error, &reply);
    sd_bus_message_unref(call);
    sd_bus_message_unref(reply);
  }
  const Status status = r < 0 ? BusFailure(r, error) : Status::Ok();
  sd_bus_error_free(&error);
  sd_bus_flush_close_unref(bus);
  return status;
}

}  // namespace tarvod
