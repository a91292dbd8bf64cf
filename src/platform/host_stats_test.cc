#include "platform/host_stats.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

namespace tarvod {
namespace {

class HostStatsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/tarvod-meminfo-XXXXXX";
    dir_ = mkdtemp(pattern);
    path_ = dir_ + "/meminfo";
    SetMeminfoPathForTesting(path_);
  }
  void TearDown() override {
    SetMeminfoPathForTesting("");
    std::error_code ignored;
    std::filesystem::remove_all(dir_, ignored);
  }
  void Write(const std::string& text) { std::ofstream(path_) << text; }
  std::string dir_, path_;
};

TEST_F(HostStatsTest, ConvertsTheFourMeminfoFieldsFromKilobytesToPages) {
  InitHostStats();
  const uint64_t page = HostPageSize();
  EXPECT_EQ(page, static_cast<uint64_t>(sysconf(_SC_PAGESIZE)));
  Write(
      "MemTotal:       16000000 kB\n"
      "MemFree:         4096000 kB\n"
      "MemAvailable:    9999999 kB\n"
      "Active(anon):       1234 kB\n"
      "Active:          2048000 kB\n"
      "Inactive:        1024000 kB\n"
      "Inactive(file):     4321 kB\n"
      "Unevictable:          64 kB\n");
  const auto stats = CreateStatContext();
  ASSERT_NE(stats, nullptr);
  EXPECT_EQ(stats->count, 4u);
  EXPECT_EQ(stats->counters[0], uint64_t{4096000} * 1024 / page);
  EXPECT_EQ(stats->counters[1], uint64_t{2048000} * 1024 / page);
  EXPECT_EQ(stats->counters[2], uint64_t{1024000} * 1024 / page);
  EXPECT_EQ(stats->counters[3], uint64_t{64} * 1024 / page);
  EXPECT_EQ(stats->counters[4], 0u);
}

TEST_F(HostStatsTest, AMissingFieldOrFileFailsAndHugeFiguresSaturate) {
  Write("MemFree: 100 kB\nActive: 100 kB\nInactive: 100 kB\n");
  EXPECT_EQ(CreateStatContext(), nullptr);
  Write("MemFree: lots\nActive: 1 kB\nInactive: 1 kB\nUnevictable: 1 kB\n");
  EXPECT_EQ(CreateStatContext(), nullptr);
  Write("MemFree: 99999999999999999 kB\nActive: 1 kB\nInactive: 1 kB\nUnevictable: 1 kB\n");
  const auto stats = CreateStatContext();
  ASSERT_NE(stats, nullptr);
  EXPECT_EQ(stats->counters[0], UINT32_MAX);
  SetMeminfoPathForTesting(dir_ + "/absent");
  EXPECT_EQ(CreateStatContext(), nullptr);
}

TEST_F(HostStatsTest, TheRealHostAnswers) {
  SetMeminfoPathForTesting("");
  EXPECT_NE(CreateStatContext(), nullptr);
  EXPECT_FALSE(HostName().empty());
  const auto address = HostIPv4Address();
  if (address) {
    EXPECT_NE(address->rfind("127.", 0), 0u);
  }
}

}  // namespace
}  // namespace tarvod
