// A private dbus-daemon for tests, configured like a system bus that denies signals except
// through tarvod's own policy file (contrib/), with its socket in a fresh directory. While it
// lives, DBUS_SYSTEM_BUS_ADDRESS points at it, so the test and the processes it starts use
// it as their system bus. Test thread only.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

#ifndef TARVOD_SOURCE_DIR
#define TARVOD_SOURCE_DIR "."
#endif

namespace tarvod::testing {

class PrivateBus {
 public:
  PrivateBus() {
    char pattern[] = "/tmp/tarvod-bus-XXXXXX";
    if (mkdtemp(pattern) == nullptr) return;
    mDirectory = pattern;
    const std::string config = mDirectory + "/bus.conf";
    std::ofstream(config)
        << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\" "
           "\"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
           "<busconfig><listen>unix:path="
        << mDirectory
        << "/bus</listen><auth>EXTERNAL</auth>"
           "<policy context=\"default\"><allow user=\"*\"/><deny own=\"*\"/>"
           "<deny send_type=\"method_call\"/><deny send_type=\"signal\"/>"
           "<allow send_requested_reply=\"true\" send_type=\"method_return\"/>"
           "<allow send_requested_reply=\"true\" send_type=\"error\"/>"
           "<allow receive_type=\"method_call\"/><allow receive_type=\"method_return\"/>"
           "<allow receive_type=\"error\"/><allow receive_type=\"signal\"/>"
           "<allow send_destination=\"org.freedesktop.DBus\"/>"
           "<allow send_destination=\"org.freedesktop.systemd1\"/></policy>"
           "<include>" TARVOD_SOURCE_DIR
           "/contrib/com.quenta.DistributedNotifications.conf"
           "</include></busconfig>\n";
    int out[2];
    if (pipe2(out, O_CLOEXEC) != 0) return;
    mPid = fork();
    if (mPid == 0) {
      // The bus ends with the test even when the test dies, and holds none of its output.
      prctl(PR_SET_PDEATHSIG, SIGTERM);
      const int null = open("/dev/null", O_RDWR);
      dup2(null, STDIN_FILENO);
      dup2(null, STDERR_FILENO);
      dup2(out[1], STDOUT_FILENO);
      execlp("dbus-daemon", "dbus-daemon", ("--config-file=" + config).c_str(), "--nofork",
             "--print-address", static_cast<char*>(nullptr));
      _exit(127);
    }
    close(out[1]);
    char buffer[512];
    ssize_t got;
    while ((got = read(out[0], buffer, sizeof buffer)) > 0) {
      mAddress.append(buffer, static_cast<size_t>(got));
      if (mAddress.find('\n') != std::string::npos) break;
    }
    close(out[0]);
    if (const size_t end = mAddress.find('\n'); end != std::string::npos) mAddress.resize(end);
    if (!mAddress.empty()) setenv("DBUS_SYSTEM_BUS_ADDRESS", mAddress.c_str(), 1);
  }
  ~PrivateBus() {
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
    if (mPid > 0) {
      kill(mPid, SIGTERM);
      waitpid(mPid, nullptr, 0);
    }
    std::error_code ignored;
    if (!mDirectory.empty()) std::filesystem::remove_all(mDirectory, ignored);
  }
  PrivateBus(const PrivateBus&) = delete;
  PrivateBus& operator=(const PrivateBus&) = delete;

  // Empty when the bus did not start.
  const std::string& address() const { return mAddress; }

 private:
  std::string mDirectory;
  std::string mAddress;
  pid_t mPid = -1;
};

}  // namespace tarvod::testing
