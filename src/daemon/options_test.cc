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

TEST(Options, DefaultsAndTheLastOccurrenceOfEachOption) {
  const std::optional<Options> defaults = Parse({});
  ASSERT_TRUE(defaults);
  EXPECT_EQ(defaults->configurationPath, "/etc/tarvod.d/tarvod.plist");
  EXPECT_EQ(defaults->rulesPath, std::nullopt);
  EXPECT_EQ(defaults->debugLevel, 0);
  EXPECT_TRUE(defaults->restoreState);

  const std::optional<Options> given = Parse({"-c", "a", "-r", "b", "-r", "c", "-n", "-v", "3"});
  ASSERT_TRUE(given);
  EXPECT_EQ(given->configurationPath, "a");
  EXPECT_EQ(given->rulesPath, "c");
  EXPECT_EQ(given->debugLevel, 3);
  EXPECT_FALSE(given->restoreState);
}

TEST(Options, OptionsStopAtTheFirstOperandAndAnEmptyRulesPathIsKept) {
  const std::optional<Options> options = Parse({"-c", "a", "-r", "b", "extra", "-r", "c"});
  ASSERT_TRUE(options);
  EXPECT_EQ(options->rulesPath, "b");
  EXPECT_EQ(Parse({"-r", ""})->rulesPath, "");
}

TEST(Options, DebugLevelIsADecimalPrefix) {
  for (const auto& [text, level] : std::vector<std::pair<std::string, int64_t>>{
           {" +4x", 4}, {"-1", -1}, {"abc", 0}, {"12", 12}}) {
    EXPECT_EQ(Parse({"-v", text})->debugLevel, level) << text;
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
