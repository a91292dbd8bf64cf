#include "daemon/options.h"

#include <unistd.h>

#include "daemon/configuration.h"
#include "plist/value.h"

namespace tarvod {

std::optional<Options> ParseOptions(int argc, char** argv) {
  Options options;
  options.configurationPath = kDefaultConfigurationPath;
  opterr = 0;  // the usage line is the only text a bad command line produces
  optind = 0;  // a fresh scan, also when called more than once in a process
  int letter;
  // "+": stop at the first operand instead of letting GNU getopt permute the rest.
  while ((letter = getopt(argc, argv, "+r:c:nv:")) != -1) {
    switch (letter) {
      case 'r':
        options.rulesPath = optarg;
        break;
      case 'c':
        options.configurationPath = optarg;
        break;
      case 'n':
        options.restoreState = false;
        break;
      case 'v':
        options.debugLevel = plist::LeadingInteger(optarg);
        break;
      default:
        return std::nullopt;
    }
  }
  return options;
}

}  // namespace tarvod
