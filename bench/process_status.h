// Shared by the benchmarks that start the real daemon: its configuration text and its memory.
#pragma once

#include <sys/types.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

namespace tarvod::bench {

inline std::string XmlString(const std::string& s) { return "<string>" + s + "</string>"; }

// A "Field:   N kB" line of /proc/PID/status, in kB; -1 when the process or field is gone.
inline long ProcStatusKb(pid_t pid, const char* field) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    if (line.rfind(field, 0) == 0) return std::atol(line.c_str() + std::strlen(field));
  }
  return -1;
}

}  // namespace tarvod::bench
