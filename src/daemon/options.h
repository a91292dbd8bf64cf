// The command line: tarvod [ -r <rules.plist>] [-c <config file> ] [-v <debug level>] [-n].
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tarvod {

struct Options {
  std::string configurationPath;
  std::optional<std::string> rulesPath;  // nullopt: the default tree
  int64_t debugLevel = 0;                // 0: the configuration's debugLevel applies
  bool restoreState = true;
};

// nullopt on an unknown option letter or a missing argument. Options stop at the first
// operand; later operands, and anything after them, are ignored.
std::optional<Options> ParseOptions(int argc, char** argv);

}  // namespace tarvod
