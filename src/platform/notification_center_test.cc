#include "platform/notification_center.h"

#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <chrono>
#include <functional>
#include <thread>

#include "platform/main_loop.h"
#include "platform/testing/log_capture.h"
#include "platform/testing/private_bus.h"

namespace tarvod {
namespace {

using plist::Dictionary;
using plist::Value;

class NotificationCenterTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(bus_.address().empty());
    ASSERT_TRUE(center_->attach(loop_).ok());
  }
  NotificationCenter::Observer Record() {
    return [this](const Notification& n) { got_.push_back(n); };
  }
  // Runs the loop until done() or five seconds have passed.
  bool RunUntil(const std::function<bool()>& done, double seconds = 5) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    while (!done() && std::chrono::steady_clock::now() < end) loop_.runSlice(20000);
    return done();
  }
  std::vector<std::string> Names() const {
    std::vector<std::string> names;
    for (const Notification& n : got_) names.push_back(n.name);
    return names;
  }

  testing::PrivateBus bus_;
  testing::LogCapture capture_{2};
  MainLoop loop_;
  std::unique_ptr<NotificationCenter> center_ = NotificationCenter::Create();
  std::vector<Notification> got_;
};

TEST_F(NotificationCenterTest, EveryValueKindTravelsAndComesBackToItsObjectOnly) {
  const Dictionary info{
      {"string", "héllo"},
      {"integer", Value::Integer(-9007199254740993)},
      {"real", Value::Real(0.25)},
      {"boolean", Value::Boolean(true)},
      {"date", Value::FromDate(plist::Date{812345678.5})},
      {"data", Value::FromData({0, 1, 255})},
      {"array", plist::Array{Value("a"), Value::Integer(1), Value(plist::Array{})}},
      {"dictionary", Dictionary{{"nested", Dictionary{{"empty", Dictionary()}}}}},
  };
  ASSERT_TRUE(center_->addObserver(this, "mine", Record()).ok());
  // Actions post from the processing queue's thread.
  std::thread([&] {
    EXPECT_TRUE(center_->post({"other", "not mine", info}).ok());
    EXPECT_TRUE(center_->post({"posted", "mine", info}).ok());
  }).join();
  ASSERT_TRUE(RunUntil([&] { return !got_.empty(); }));
  EXPECT_EQ(Names(), std::vector<std::string>{"posted"});
  EXPECT_EQ(got_[0].object, "mine");
  EXPECT_EQ(got_[0].userInfo, info);
}

TEST_F(NotificationCenterTest, SuspensionHoldsWhatArrivesWhileObservationsChange) {
  ASSERT_TRUE(center_->addObserver(this, "a", Record()).ok());
  center_->suspend();
  center_->removeObserver(this, "a");
  for (const char* object : {"a", "b", "a"}) {
    ASSERT_TRUE(SendNotification({std::string("to ") + object, object, Dictionary()}).ok());
  }
  RunUntil([] { return false; }, 0.3);
  EXPECT_TRUE(got_.empty());
  ASSERT_TRUE(center_->addObserver(this, "a", Record()).ok());
  center_->resume();
  ASSERT_TRUE(RunUntil([&] { return got_.size() >= 2; }));
  EXPECT_EQ(Names(), (std::vector<std::string>{"to a", "to a"}));
}

TEST_F(NotificationCenterTest, HostileSignalsAreRefusedAndTheNextOneArrives) {
  ASSERT_TRUE(center_->addObserver(this, "a", Record()).ok());
  // Each from a connection of its own.
  auto emit = [](const std::function<int(sd_bus_message*)>& build) {
    sd_bus* sender = nullptr;
    sd_bus_message* m = nullptr;
    int r = sd_bus_open_system(&sender);
    if (r >= 0) {
      r = sd_bus_message_new_signal(sender, &m, kNotificationPath, kNotificationInterface,
                                    kNotificationMember);
    }
    if (r >= 0) r = build(m);
    if (r >= 0) r = sd_bus_send(sender, m, nullptr);
    if (r >= 0) r = sd_bus_flush(sender);
    sd_bus_message_unref(m);
    sd_bus_flush_close_unref(sender);
    return r;
  };
  // Wrong signature.
  EXPECT_GE(emit([](sd_bus_message* m) { return sd_bus_message_append(m, "ssi", "n", "a", 5); }),
            0);
  // User information nested deeper than the limit.
  EXPECT_GE(emit([](sd_bus_message* m) {
              int r = sd_bus_message_append(m, "ss", "deep", "a");
              const int levels = kMaxNotificationDepth / 2 + 4;
              for (int i = 0; i < levels && r >= 0; ++i) {
                r = sd_bus_message_open_container(m, 'a', "{sv}");
                if (r >= 0) r = sd_bus_message_open_container(m, 'e', "sv");
                if (r >= 0) r = sd_bus_message_append_basic(m, 's', "k");
                if (r >= 0)
                  r = sd_bus_message_open_container(m, 'v', i + 1 < levels ? "a{sv}" : "s");
              }
              if (r >= 0) r = sd_bus_message_append_basic(m, 's', "bottom");
              for (int i = 0; i < levels && r >= 0; ++i) {
                for (int c = 0; c < 3 && r >= 0; ++c) r = sd_bus_message_close_container(m);
              }
              return r;
            }),
            0);
  // More than the byte limit.
  const std::string big(kMaxNotificationBytes, 'x');
  EXPECT_GE(emit([&](sd_bus_message* m) {
              return sd_bus_message_append(m, "ssa{sv}", "big", "a", 1, "blob", "s", big.c_str());
            }),
            0);
  EXPECT_GE(emit([](sd_bus_message* m) { return sd_bus_message_append(m, "ss", "fine", "a"); }), 0);

  // Senders on different connections may arrive in any order.
  auto refusals = [&] {
    const std::string log = capture_.text();
    size_t count = 0;
    for (size_t at = log.find("refused"); at != std::string::npos;
         at = log.find("refused", at + 1)) {
      ++count;
    }
    return count;
  };
  EXPECT_TRUE(RunUntil([&] { return !got_.empty() && refusals() == 3; })) << capture_.text();
  EXPECT_EQ(Names(), std::vector<std::string>{"fine"}) << capture_.text();
  EXPECT_FALSE(got_[0].userInfo.has_value());
  const std::string log = capture_.text();
  for (const char* why :
       {"arguments (ssi) are not (ssa{sv})", "nested deeper than", "larger than"}) {
    EXPECT_NE(log.find(why), std::string::npos) << why << "\n" << log;
  }
}

}  // namespace
}  // namespace tarvod
