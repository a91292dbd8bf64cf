#include "sources/audit_pipe.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <random>
#include <vector>

#include "sources/monitor.h"

namespace tarvod {
namespace {

using Bytes = std::vector<uint8_t>;

struct RecordBuilder {
  Bytes bytes;
  RecordBuilder& put(uint64_t value, int width) {
    for (int i = width - 1; i >= 0; --i) bytes.push_back(static_cast<uint8_t>(value >> (8 * i)));
    return *this;
  }
  RecordBuilder& raw(const Bytes& b) {
    bytes.insert(bytes.end(), b.begin(), b.end());
    return *this;
  }
  RecordBuilder& header32(uint16_t event) {
    return put(0x14, 1).put(0, 4).put(11, 1).put(event, 2).put(0, 2).put(0, 4).put(0, 4);
  }
  RecordBuilder& subject(uint32_t type, const Bytes& address) {
    put(0x7a, 1);
    for (int i = 0; i < 8; ++i) put(1000 + i, 4);  // audit, effective, real IDs; pid, sid, port
    return put(type, 4).raw(address);
  }
  RecordBuilder& text(std::string_view s) {
    put(0x28, 1).put(s.size() + 1, 2);
    raw(Bytes(s.begin(), s.end()));
    return put(0, 1);
  }
  RecordBuilder& ret(uint8_t status, uint32_t value) {
    return put(0x27, 1).put(status, 1).put(value, 4);
  }
  RecordBuilder& trailer() { return put(0x13, 1).put(0xb105, 2).put(bytes.size() + 7, 4); }
};

Bytes Ipv4() { return {192, 0, 2, 7}; }
Bytes Ipv6() { return {0x20, 0x01, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1}; }

const plist::Dictionary& Details(const plist::Dictionary& event) {
  return *event.findDictionary("eventDetails");
}

TEST(AuditRecord, ASuccessfulSshLoginBecomesAuthSuccess) {
  Bytes record = RecordBuilder()
                     .header32(kSshLoginEvent)
                     .subject(4, Ipv4())
                     .text("successful login alice")
                     .ret(0, 0)
                     .trailer()
                     .bytes;
  const auto event = AuditRecordToEvent(record);
  ASSERT_TRUE(event);
  const plist::Dictionary expected{
      {"eventType", "auth.success"},
      {"eventDetails", plist::Dictionary{{"clientIP", "192.0.2.7"},
                                         {"message", "successful login alice"},
                                         {"protocolName", "SSH"},
                                         {"username", "untrusted"}}},
      {"eventSource", "Auditpipe"}};
  EXPECT_EQ(*event, expected);
}

struct Case {
  const char* name;
  Bytes record;
  std::optional<std::string> type;  // nullopt: no event
  std::optional<std::string> clientIP;
  std::optional<std::string> message;
};

std::vector<Case> Cases() {
  auto full = [](uint32_t value) {
    return RecordBuilder().header32(kSshLoginEvent).subject(4, Ipv4()).text("m").ret(1, value);
  };
  Bytes truncated = full(0).trailer().bytes;
  truncated.resize(truncated.size() - 9);  // stops inside the return token
  Bytes badText = RecordBuilder().header32(kSshLoginEvent).bytes;
  RecordBuilder invalid;
  invalid.put(0x28, 1).put(3, 2).raw({0xC3, 0x28, 0});
  badText.insert(badText.end(), invalid.bytes.begin(), invalid.bytes.end());
  return {
      {"failure with 255", full(255).trailer().bytes, "auth.failure", "192.0.2.7", "m"},
      {"failure with another value", full(1).bytes, "auth.failure", "192.0.2.7", "m"},
      {"no return token",
       RecordBuilder().header32(kSshLoginEvent).subject(4, Ipv4()).text("m").bytes, "auth.failure",
       "192.0.2.7", "m"},
      {"another event type", RecordBuilder().header32(32801).ret(0, 0).bytes, std::nullopt,
       std::nullopt, std::nullopt},
      {"IPv6", RecordBuilder().header32(kSshLoginEvent).subject(16, Ipv6()).ret(0, 0).bytes,
       "auth.success", "2001:db8::1", std::nullopt},
      {"type 0", RecordBuilder().header32(kSshLoginEvent).subject(0, Bytes(16, 0)).ret(0, 0).bytes,
       "auth.success", "invalid", std::nullopt},
      {"no subject", RecordBuilder().header32(kSshLoginEvent).text("m").ret(0, 0).bytes,
       "auth.success", std::nullopt, "m"},
      {"no text", RecordBuilder().header32(kSshLoginEvent).subject(4, Ipv4()).ret(0, 0).bytes,
       "auth.success", "192.0.2.7", std::nullopt},
      {"truncated in a token", truncated, std::nullopt, std::nullopt, std::nullopt},
      {"a later subject replaces an earlier one",
       RecordBuilder()
           .header32(kSshLoginEvent)
           .subject(4, Ipv4())
           .subject(16, Ipv6())
           .ret(0, 0)
           .bytes,
       "auth.success", "2001:db8::1", std::nullopt},
      {"a zero return after a failure still succeeds",
       RecordBuilder().header32(kSshLoginEvent).ret(1, 5).ret(0, 0).bytes, "auth.success",
       std::nullopt, std::nullopt},
      {"text that is not UTF-8", badText, "auth.failure", std::nullopt, std::nullopt},
      {"no header at all", RecordBuilder().ret(0, 0).bytes, "auth.success", std::nullopt,
       std::nullopt},
  };
}

TEST(AuditRecord, ConvertsEveryKindOfRecordAsSpecified) {
  for (const Case& c : Cases()) {
    SCOPED_TRACE(c.name);
    const auto event = AuditRecordToEvent(c.record);
    ASSERT_EQ(event.has_value(), c.type.has_value());
    if (!event) continue;
    EXPECT_EQ(*event->findString("eventType"), *c.type);
    EXPECT_EQ(*event->findString("eventSource"), "Auditpipe");
    const plist::Dictionary& details = Details(*event);
    EXPECT_EQ(*details.findString("protocolName"), "SSH");
    EXPECT_EQ(*details.findString("username"), "untrusted");
    const std::string* ip = details.findString("clientIP");
    EXPECT_EQ(ip ? std::optional<std::string>(*ip) : std::nullopt, c.clientIP);
    const std::string* message = details.findString("message");
    EXPECT_EQ(message ? std::optional<std::string>(*message) : std::nullopt, c.message);
  }
}

TEST(AuditRecord, TerminalAddressesFormatByType) {
  std::array<uint8_t, 16> address{};
  std::copy_n(Ipv6().begin(), 16, address.begin());
  EXPECT_EQ(FormatTerminalAddress(16, address), "2001:db8::1");
  EXPECT_EQ(FormatTerminalAddress(4, {10, 1, 2, 3}), "10.1.2.3");
  EXPECT_EQ(FormatTerminalAddress(0, address), "invalid");
  EXPECT_EQ(FormatTerminalAddress(6, address), "invalid");
}

TEST(AuditRecord, ConvertedEventsReachTheMonitor) {
  std::vector<plist::Dictionary> seen;
  MonitorHooks hooks;
  hooks.dispatch = [&](const plist::Dictionary& event) { seen.push_back(event); };
  Monitor monitor(hooks);
  ConvertAuditRecord(RecordBuilder().header32(kSshLoginEvent).ret(0, 0).bytes, monitor);
  ConvertAuditRecord(RecordBuilder().header32(1).bytes, monitor);
  ASSERT_EQ(seen.size(), 1u);
  EXPECT_EQ(*seen[0].findString("eventType"), "auth.success");
}

TEST(AuditRecord, RandomAndMutatedRecordsNeverCrash) {
  std::mt19937 random(99);
  const Bytes base = RecordBuilder()
                         .header32(kSshLoginEvent)
                         .subject(16, Ipv6())
                         .text("login")
                         .ret(0, 0)
                         .trailer()
                         .bytes;
  for (int round = 0; round < 20000; ++round) {
    Bytes bytes = base;
    if (round % 3 == 0) {
      bytes.resize(random() % 96);
      for (auto& b : bytes) b = static_cast<uint8_t>(random());
    } else {
      for (int flips = 0; flips < 1 + round % 5; ++flips) bytes[random() % bytes.size()] = random();
      if (round % 3 == 2) bytes.resize(random() % bytes.size());
    }
    auto copy = std::make_unique<uint8_t[]>(bytes.size() + 1);
    std::copy(bytes.begin(), bytes.end(), copy.get());
    (void)AuditRecordToEvent(std::span<const uint8_t>(copy.get(), bytes.size()));
  }
}

TEST(AuditPipe, OpeningFailsWithoutTheDeviceAndReportsTheErrorNumber) {
  int descriptor = -1;
  uint64_t size = 0;
  EXPECT_EQ(OpenAuditPipe(&descriptor, &size), ENOENT);
  EXPECT_EQ(descriptor, -1);
}

}  // namespace
}  // namespace tarvod
