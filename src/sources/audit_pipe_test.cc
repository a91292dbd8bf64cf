#include "sources/audit_pipe.h"

#include <gtest/gtest.h>

#include <memory>
#include <random>
#include <vector>

#include "sources/bsm.h"
#include "sources/monitor.h"
#include "sources/testing/bsm_bytes.h"

namespace tarvod {
namespace {

using namespace ::tarvod::testing;

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
  badText = Cat({badText, MakeToken(0x28, Cat({U(3, 2), Bytes{0xC3, 0x28, 0}}))});
  return {
      {"failure with 255", full(255).trailer().bytes, "auth.failure", "192.0.2.7", "m"},
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
    EXPECT_EQ(event->size(), 3u);
    EXPECT_EQ(*event->findString("eventType"), *c.type);
    EXPECT_EQ(*event->findString("eventSource"), "Auditpipe");
    const plist::Dictionary& details = Details(*event);
    EXPECT_EQ(*details.findString("protocolName"), "SSH");
    EXPECT_EQ(*details.findString("username"), "untrusted");
    const std::string* ip = details.findString("clientIP");
    EXPECT_EQ(ip ? std::optional<std::string>(*ip) : std::nullopt, c.clientIP);
    const std::string* message = details.findString("message");
    EXPECT_EQ(message ? std::optional<std::string>(*message) : std::nullopt, c.message);
    EXPECT_EQ(details.size(), 2u + (ip != nullptr) + (message != nullptr));
  }
}

TEST(AuditRecord, ATokenOfAnyTypeBetweenHeaderAndReturnKeepsTheRecord) {
  for (const auto& [name, token] : EveryTokenType()) {
    SCOPED_TRACE(name);
    const Bytes record = RecordBuilder()
                             .header32(kSshLoginEvent)
                             .subject(4, Ipv4())
                             .raw(token)
                             .ret(0, 0)
                             .trailer()
                             .bytes;
    const auto event = AuditRecordToEvent(record);
    ASSERT_TRUE(event);
    EXPECT_EQ(*event->findString("eventType"), "auth.success");
  }
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

// Random bytes and mutated, cut records, each on a heap copy of exactly its size so that the
// sanitizers see any overrun, through the conversion and the token walk.
TEST(AuditRecord, RandomAndMutatedRecordsNeverCrashOrOverrun) {
  std::mt19937 random(99);
  const Bytes login = RecordBuilder()
                          .header32(kSshLoginEvent)
                          .subject(16, Ipv6())
                          .text("login")
                          .ret(0, 0)
                          .trailer()
                          .bytes;
  Bytes everyType;
  for (const auto& [name, token] : EveryTokenType()) everyType = Cat({everyType, token});
  for (int round = 0; round < 30000; ++round) {
    Bytes bytes;
    if (round % 3 == 0) {
      bytes.resize(random() % 96);
      for (auto& b : bytes) b = static_cast<uint8_t>(random());
      if (!bytes.empty() && round % 2) bytes[0] = static_cast<uint8_t>(0x10 + random() % 0x74);
    } else {
      bytes = round % 3 == 1 ? login : everyType;
      for (int flips = 0; flips < 1 + round % 5; ++flips) bytes[random() % bytes.size()] = random();
      if (round % 2) bytes.resize(random() % (bytes.size() + 1));
    }
    auto copy = std::make_unique<uint8_t[]>(bytes.size() + 1);
    std::copy(bytes.begin(), bytes.end(), copy.get());
    const std::span<const uint8_t> span(copy.get(), bytes.size());
    (void)AuditRecordToEvent(span);
    for (size_t offset = 0; offset < span.size();) {
      const auto token = bsm::FetchToken(span.subspan(offset));
      if (!token) break;
      ASSERT_GT(token->length, 0u);
      ASSERT_LE(token->length, span.size() - offset);
      offset += token->length;
    }
  }
}

// The missing device is reported by the daemon, checked in tests/.
}  // namespace
}  // namespace tarvod
