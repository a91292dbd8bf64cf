#include "actions/send_email_action.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/testing/fake_process_launcher.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::HasSubstr;

constexpr const char* kRulesFile = "/rules/mail.plist";

TEST(SendEmail, FlattensNestedCommaSeparatedListsAndUnescapesOnlyAPrefixColon) {
  const Array levelFour{Array{Array{Array{Value("deep4@x.com")}}}};
  const Array levelFive{Array{Array{Array{Array{Value("deep5@x.com")}}}}};
  struct Case {
    Array list;
    std::vector<std::string> addresses;
  } cases[] = {
      {{Value(" a@x.com,b@y.com ,\nc@z.com ")}, {"a@x.com", "b@y.com", "c@z.com"}},
      {{Value("a@x.com,"), Value::Integer(4)}, {"a@x.com", ""}},
      {{Value("fr\\:a@x.fr"), Value("abcd\\:x"), Value("abcde\\:x"), Value("a\\:b\\:c\\:d")},
       {"fr:a@x.fr", "abcd:x", "abcde\\:x", "a:b:c\\:d"}},
      {{Value("top@x.com"), Value(levelFour), Value(levelFive)}, {"top@x.com", "deep4@x.com"}},
  };
  for (const Case& c : cases) {
    testing::LogCapture capture(1);
    EXPECT_THAT(FlattenRecipients(c.list), ElementsAreArray(c.addresses));
    EXPECT_EQ(capture.text().find("too many levels of nesting") != std::string::npos,
              &c == &cases[3]);
  }
}

TEST(SendEmail, EncodesDisplayNamesAsOneQEncodedWord) {
  const std::pair<std::string, std::string> words[] = {
      {"Alert", "Alert"},
      {"a=b_c", "a=b_c"},
      {"", ""},
      {"Disk full", "=?UTF-8?Q?Disk_full?="},
      {"x=1 y", "=?UTF-8?Q?x=3D1_y?="},
      {"50% used", "=?UTF-8?Q?50=25_used?="},
      {"Caf\xC3\xA9", "=?UTF-8?Q?Caf=C3=A9?="},
      {"a?b\tc\r\nd_", "=?UTF-8?Q?a=3Fb=09c=0D_d=5F?="},
  };
  for (const auto& [text, word] : words) EXPECT_EQ(EncodedWord(text), word) << text;
  const std::pair<std::string, std::string> addresses[] = {
      {"Ren\xC3\xA9 <r@x.fr>", "=?UTF-8?Q?Ren=C3=A9_?=<r@x.fr>"},
      {"Bob<b@x.com>", "Bob<b@x.com>"},
      {"a <b> <c@x.com>", "=?UTF-8?Q?a_=3Cb=3E_?=<c@x.com>"},
      {"plain@x.com", "plain@x.com"},
  };
  for (const auto& [address, encoded] : addresses) EXPECT_EQ(EncodedAddress(address), encoded);
}

TEST(SendEmail, ShortMessagesKeepAtMost159BytesOfWholeCharacters) {
  const std::string e = "\xC3\xA9";  // two bytes
  const std::pair<std::string, std::string> cases[] = {
      {std::string(500, 'a'), std::string(159, 'a') + "\n"},
      {"ten chars!", "ten chars!\n"},
      {"", "\n"},
      {std::string(158, 'a') + e, std::string(158, 'a') + "\n"},
      {std::string(157, 'a') + e + "b", std::string(157, 'a') + e + "\n"},
  };
  for (const auto& [message, body] : cases) EXPECT_EQ(ShortMessageBody(message), body);
  EXPECT_THAT(RemoveRepeatedAddresses({"a", "b", "a", "", "b", ""}), ElementsAre("a", "b", ""));
}

class SendEmailTest : public ::testing::Test {
 protected:
  void SetUp() override {
    store_ = std::make_shared<VariableStore>();
    store_->set(kGlobalsKey, Dictionary{{"pair", Array{Value("p1@x.com"), Value("p2@x.com")}},
                                        {"evil", Value("x@y.com>\r\nBcc: spy@z.com")},
                                        {"host", Value("a:b")}});
    context_ = std::make_unique<Context>(store_, std::make_shared<Rulebase>(),
                                         Dictionary{{"eventType", "t"}});
    handler_.setPrograms({"/bin/mail", "/bin/femail"});
  }
  int Send(Dictionary action) {
    const Dictionary rule{{"filePath", kRulesFile}};
    return handler_.send(action, FiredRule{rule, "mail", kRulesFile}, *context_);
  }
  // The argument vector after the program name.
  std::vector<std::string> Arguments(size_t i) const {
    const auto& arguments = launcher_.requests.at(i).arguments;
    return {arguments.begin() + 1, arguments.end()};
  }

  testing::LogCapture capture_{3};
  FakeProcessLauncher launcher_;
  SendEmailAction handler_{launcher_, false};
  VariableStorePtr store_;
  std::unique_ptr<Context> context_;
};

TEST_F(SendEmailTest, RelayModeWritesTheHeaderBlockAnEmptyLineAndTheMessage) {
  SetDebugLevel(5);
  EXPECT_EQ(
      Send(Dictionary{{"recipientAddresses", Array{Value("a@x.com, b@x.com"), Value("a@x.com")}},
                      {"ccAddresses", "Ren\xC3\xA9 <r@x.com>"},
                      {"relayHost", "smtp.x.com:587"},
                      {"adminEmail", "root@x.com"},
                      {"subject", "Disk full on ${global:host}"},
                      {"message", "To: injected@x.com\nbody ${global:host}"}}),
      0);
  ASSERT_EQ(launcher_.requests.size(), 1u);
  const LaunchRequest& request = launcher_.requests[0];
  EXPECT_EQ(request.program, "/bin/femail");
  EXPECT_THAT(Arguments(0), ElementsAre("-t"));
  EXPECT_THAT(*request.environment, ElementsAre("SMTPHOST=smtp.x.com:587"));
  EXPECT_EQ(*request.input,
            "To: a@x.com,b@x.com\n"
            "Cc: =?UTF-8?Q?Ren=C3=A9_?=<r@x.com>\n"
            "Subject: =?UTF-8?Q?Disk_full_on_a=3Ab?=\n"
            "From: root@x.com\n"
            "\n"
            "To: injected@x.com\nbody a:b");
  EXPECT_EQ(request.redirections[1].descriptor, 1);
  EXPECT_EQ(request.redirections[2].descriptor, 2);
  EXPECT_TRUE(testing::LinesInOrder(
      capture_.text(), {"    Recipients: a@x.com, b@x.com\n",
                        "    CC'd Recipients: =?UTF-8?Q?Ren=C3=A9_?=<r@x.com>\n",
                        "    Relay Host: smtp.x.com:587\n", "    Admin EMail: root@x.com\n",
                        "    Headers: To: ", "    Mail command:\n      /bin/femail \"-t\"\n"}))
      << capture_.text();
}

TEST_F(SendEmailTest, RelayHostFallsBackToTheFileVariableThenTheGlobalOne) {
  const struct Case {
    std::optional<std::string> key, fileVariable, globalVariable;
    std::string expected;  // empty: local mode
  } cases[] = {
      {std::nullopt, "file.x", "global.x", "file.x"},
      {std::nullopt, std::nullopt, "global.x", "global.x"},
      {std::nullopt, std::nullopt, std::nullopt, ""},
      {"${undefined}", "file.x", "global.x", "global.x"},
      {"key.x", "file.x", "global.x", "key.x"},
      {std::nullopt, "", "global.x", ""},
  };
  for (const Case& c : cases) {
    launcher_.requests.clear();
    Dictionary file, globals = store_->find(kGlobalsKey)->dictionary();
    if (c.fileVariable) file.set("relayHost", Value(*c.fileVariable));
    globals.erase("relayHost");
    if (c.globalVariable) globals.set("relayHost", Value(*c.globalVariable));
    store_->set(kRulesFile, file);
    store_->set(kGlobalsKey, globals);
    Dictionary action{{"recipientAddresses", "a@x.com"}};
    if (c.key) action.set("relayHost", Value(*c.key));
    Send(action);
    ASSERT_EQ(launcher_.requests.size(), 1u);
    EXPECT_EQ(launcher_.requests[0].program, c.expected.empty() ? "/bin/mail" : "/bin/femail");
    if (!c.expected.empty()) {
      EXPECT_THAT(*launcher_.requests[0].environment, ElementsAre("SMTPHOST=" + c.expected));
    }
  }
}

TEST_F(SendEmailTest, AddressesThatWouldForgeHeadersOrOptionsAreDropped) {
  Send(Dictionary{{"recipientAddresses", Array{Value("${global:evil}"), Value("ok@x.com")}},
                  {"ccAddresses", Array{Value("Line\nBreak <n@x.com>")}},
                  {"adminEmail", "root@x.com\nBcc: spy@z.com"},
                  {"relayHost", "smtp.x.com"}});
  ASSERT_EQ(launcher_.requests.size(), 1u);
  EXPECT_EQ(*launcher_.requests[0].input, "To: ok@x.com\nCc: =?UTF-8?Q?Line_Break_?=<n@x.com>\n\n");
  const std::string log = capture_.text();
  EXPECT_THAT(log, HasSubstr("SendMail: Dropping the address 'x@y.com>\\r\\nBcc: spy@z.com'"));
  EXPECT_THAT(log, HasSubstr("SendMail: Dropping the sender 'root@x.com\\nBcc: spy@z.com'"));

  launcher_.requests.clear();
  Send(Dictionary{{"recipientAddresses", "-oQ/tmp/x"}, {"message", "m"}});
  EXPECT_TRUE(launcher_.requests.empty());
  EXPECT_THAT(capture_.text(), HasSubstr("the mail command would read it as an option"));
}

TEST_F(SendEmailTest, FailuresAbortTheActionOrAreRemembered) {
  EXPECT_EQ(Send(Dictionary{{"recipientAddresses", Value::Integer(3)}}), 1);
  EXPECT_THAT(capture_.text(), HasSubstr("The recipientAddresses key is not an array"));
  EXPECT_EQ(Send(Dictionary{{"ccAddresses", Array{Value("${global:pair")}}}), 1);
  EXPECT_EQ(Send(Dictionary{}), 0);
  EXPECT_THAT(capture_.text(), HasSubstr("Skipping sending mail message because there are no "
                                         "recipients"));
  EXPECT_TRUE(launcher_.requests.empty());

  launcher_.status = 75;
  EXPECT_EQ(Send(Dictionary{{"recipientAddresses", "a@x.com, b@x.de"}}), 75);
  EXPECT_EQ(launcher_.requests.size(), 2u);  // the second language is still served

  launcher_.failLaunch = true;
  EXPECT_EQ(Send(Dictionary{{"recipientAddresses", "a@x.com"}}), 1);
  EXPECT_THAT(capture_.text(), HasSubstr("SendMail: Can't start /bin/mail"));

  launcher_.failLaunch = false;
  launcher_.runsForever = true;
  handler_.setTimeout(5);
  EXPECT_EQ(Send(Dictionary{{"recipientAddresses", "a@x.com"}}), 128 + 9);
  EXPECT_EQ(launcher_.terminations, 1);
  EXPECT_EQ(launcher_.requests.back().inputSeconds, 5);
}

}  // namespace
}  // namespace tarvod
