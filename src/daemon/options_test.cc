#include "daemon/options.h"

#include <gtest/gtest.h>

#include <vector>

namespace tarvod {
namespace {

std::optional<Options> Parse(std::vector<std::string> args) {
  args.insert(args.begin(), "tarvod");
  std::vector<char*> argv;
  for (std::string& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  return ParseOptions(static_cast<int>(args.size()), argv.data());
}

// The last occurrence wins, options stop at the first operand, the level is a decimal prefix.
TEST(Options, ParsesTheCommandLine) {
  const struct Case {
    std::vector<std::string> args;
    std::string configuration;
    std::optional<std::string> rules;
    int64_t debugLevel;
    bool restore;
  } cases[] = {
      {{}, "/etc/tarvod.d/tarvod.plist", std::nullopt, 0, true},
      {{"-c", "a", "-r", "b", "-r", "c", "-n", "-v", "3"}, "a", "c", 3, false},
      {{"-c", "a", "-r", "b", "extra", "-r", "c"}, "a", "b", 0, true},
      {{"-r", ""}, "/etc/tarvod.d/tarvod.plist", "", 0, true},
      {{"-v", " +4x"}, "/etc/tarvod.d/tarvod.plist", std::nullopt, 4, true},
      {{"-v", "-1"}, "/etc/tarvod.d/tarvod.plist", std::nullopt, -1, true},
      {{"-v", "abc"}, "/etc/tarvod.d/tarvod.plist", std::nullopt, 0, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::PrintToString(c.args));
    const std::optional<Options> options = Parse(c.args);
    ASSERT_TRUE(options);
    EXPECT_EQ(options->configurationPath, c.configuration);
    EXPECT_EQ(options->rulesPath, c.rules);
    EXPECT_EQ(options->debugLevel, c.debugLevel);
    EXPECT_EQ(options->restoreState, c.restore);
  }
}

TEST(Options, UnknownLettersAndMissingArgumentsAreUsageErrors) {
  for (const std::vector<std::string>& args :
       {std::vector<std::string>{"-x"}, {"-c"}, {"-r", "rules", "-v"}}) {
    EXPECT_FALSE(Parse(args));
  }
}

}  // namespace
}  // namespace tarvod
