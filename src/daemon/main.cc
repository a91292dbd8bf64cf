#include "daemon/daemon.h"

int main(int argc, char** argv) { return tarvod::DaemonMain(argc, argv); }
