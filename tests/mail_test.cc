// The mail actions in the real daemon: relay mode through femail to aiosmtpd, local mode through
// a recording mail program, and bsd-mailx handing the mail to a sendmail stand-in.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "harness.h"
#include "rules_xml.h"

namespace tarvod::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::UnorderedElementsAre;

// Each mail it accepts becomes a file: "MAIL FROM:<x>", one "RCPT TO:<y>" line per envelope
// recipient, an empty line, then the data as received. Recipients at refused.example are
// refused.
constexpr const char* kSmtpServer = R"(
import asyncio, os, sys
from aiosmtpd.smtp import SMTP

class Recorder:
    count = 0
    async def handle_RCPT(self, server, session, envelope, address, options):
        if address.endswith('@refused.example'):
            return '550 no such user here'
        envelope.rcpt_tos.append(address)
        return '250 OK'
    async def handle_DATA(self, server, session, envelope):
        Recorder.count += 1
        path = os.path.join(sys.argv[1], 'mail-%d' % Recorder.count)
        head = 'MAIL FROM:<%s>\n' % envelope.mail_from
        head += ''.join('RCPT TO:<%s>\n' % r for r in envelope.rcpt_tos)
        with open(path + '.tmp', 'wb') as f:
            f.write(head.encode() + b'\n' + envelope.original_content)
        os.rename(path + '.tmp', path)
        return '250 OK'

async def main():
    server = await asyncio.get_running_loop().create_server(
        lambda: SMTP(Recorder()), '127.0.0.1', 0)
    with open(sys.argv[2] + '.tmp', 'w') as f:
        f.write('%d\n' % server.sockets[0].getsockname()[1])
    os.rename(sys.argv[2] + '.tmp', sys.argv[2])
    await server.serve_forever()

asyncio.run(main())
)";

// A program that records its argument vector and standard input in a file of its own in
// directory.
std::string Recorder(const std::string& directory) {
  return "#!/bin/sh\nout=" + directory + "/$$\n" +
         R"({ for a in "$@"; do printf '[%s]' "$a"; done; echo; cat; } > "$out.tmp"
mv "$out.tmp" "$out"
)";
}

struct Mail {
  std::string from;
  std::set<std::string> recipients;
  std::map<std::string, std::string> headers;
  std::string body;  // line ends as LF
};

// The data's line ends are CRLF; anything else is kept, so that a stray CR shows.
Mail ParseMail(std::string text) {
  for (size_t at = 0; (at = text.find("\r\n", at)) != std::string::npos; ++at) text.erase(at, 1);
  Mail mail;
  const size_t envelopeEnd = text.find("\n\n");
  const size_t headersEnd = text.find("\n\n", envelopeEnd + 2);
  std::istringstream envelope(text.substr(0, envelopeEnd));
  for (std::string line; std::getline(envelope, line);) {
    const std::string address = line.substr(line.find('<') + 1, line.size() - line.find('<') - 2);
    if (line.starts_with("MAIL FROM:")) mail.from = address;
    if (line.starts_with("RCPT TO:")) mail.recipients.insert(address);
  }
  std::istringstream headers(text.substr(envelopeEnd + 2, headersEnd - envelopeEnd - 2));
  for (std::string line; std::getline(headers, line);) {
    const size_t colon = line.find(": ");
    if (colon != std::string::npos) mail.headers[line.substr(0, colon)] = line.substr(colon + 2);
  }
  mail.body = headersEnd == std::string::npos ? "" : text.substr(headersEnd + 2);
  return mail;
}

std::vector<std::string> FilesIn(const std::string& directory) {
  std::vector<std::string> texts;
  for (const auto& entry : std::filesystem::directory_iterator(directory)) {
    if (entry.path().extension() != ".tmp") texts.push_back(ReadFile(entry.path()));
  }
  return texts;
}

bool WaitForFiles(const std::string& directory, size_t count) {
  for (int i = 0; i < 200; ++i) {
    if (FilesIn(directory).size() >= count) return true;
    usleep(50000);
  }
  return false;
}

class SmtpServer {
 public:
  explicit SmtpServer(const TempDir& dir) : mMailDir(dir.file("smtp")) {
    std::filesystem::create_directories(mMailDir);
    const std::string script = dir.write("smtp_server.py", kSmtpServer);
    const std::string portFile = dir.file("smtp.port");
    mPid = fork();
    if (mPid == 0) {
      execl("/usr/bin/python3", "python3", script.c_str(), mMailDir.c_str(), portFile.c_str(),
            static_cast<char*>(nullptr));
      _exit(127);
    }
    for (int i = 0; i < 200 && !FileExists(portFile); ++i) usleep(50000);
    const std::string port = ReadFile(portFile);
    if (!port.empty()) mAddress = "127.0.0.1:" + port.substr(0, port.find('\n'));
  }
  ~SmtpServer() {
    kill(mPid, SIGKILL);
    waitpid(mPid, nullptr, 0);
  }
  SmtpServer(const SmtpServer&) = delete;
  SmtpServer& operator=(const SmtpServer&) = delete;

  const std::string& address() const { return mAddress; }  // empty: it did not start
  // The mails received, by envelope recipient.
  std::map<std::string, Mail> mails() const {
    std::map<std::string, Mail> byRecipient;
    for (const std::string& text : FilesIn(mMailDir)) {
      const Mail mail = ParseMail(text);
      for (const std::string& recipient : mail.recipients) byRecipient[recipient] = mail;
    }
    return byRecipient;
  }
  size_t count() const { return FilesIn(mMailDir).size(); }

 private:
  std::string mMailDir;
  std::string mAddress;
  pid_t mPid = -1;
};

class MailTest : public TarvodTest {
 protected:
  // Runs the actions at debug level 3, femail as the relay program; returns the error log.
  std::string runMail(const std::vector<std::string>& actions, ConfigEntries config = {},
                      const std::vector<std::string>& launcher = {}) {
    config.push_back({"authLogSource", Str("none")});
    config.push_back({"relayMailProgram", Str(FEMAIL_BINARY_PATH)});
    return runActions(actions, 3, config, launcher);
  }
};

TEST_F(MailTest, RelayModeDeliversEachLanguageThroughFemailToAnSmtpServer) {
  SmtpServer server(dir);
  ASSERT_FALSE(server.address().empty()) << "aiosmtpd did not start";
  const std::string relay = Str(server.address());
  dir.write("bundle/fr.lproj/Localizable.strings",
            "\"Hello ${event:eventType}\" = \"Bonjour ${event:eventType}\";\n"
            "\"Alert\" = \"Alerte urgente\";\n");
  dir.write("bundle/en.lproj/Localizable.strings", "\"Alert\" = \"Alert\";\n");
  const std::string log = runMail({
      Dict({{"type", Str("sendemail")},
            {"recipientAddresses",
             Arr({Str("a@x.com, Ren\xC3\xA9 Dupont <r@x.com>"), Str("a@x.com")})},
            {"ccAddresses", Str("c@x.com")},
            {"relayHost", relay},
            {"adminEmail", Str("admin@x.com")},
            {"subject", Str("Disk full")},
            {"message", Str("Bcc: spy@evil.com\nfrom ${event:eventType}\n")}}),
      Dict({{"type", Str("SendEmail")},
            {"recipientAddresses", Str("fr:f@x.com, e@x.com")},
            {"ccAddresses", Str("fr\\:g@x.com")},
            {"relayHost", relay},
            {"subject", Str("Alert")},
            {"message", Str("Hello ${event:eventType}")},
            {"localizationBundlePath", Str(dir.file("bundle"))}}),
      // Header injection through each field: nothing reaches the envelope or the headers.
      Dict({{"type", Str("sendemail")},
            {"recipientAddresses", Arr({Str("victim@x.com\nBcc: spy@evil.com"), Str("ok@x.com")})},
            {"relayHost", relay},
            {"adminEmail", Str("admin@x.com\nBcc: spy2@evil.com")},
            {"subject", Str("Hi\nBcc: spy3@evil.com")},
            {"message", Str("m")}}),
      Dict({{"type", Str("sendpage")},
            {"recipientAddresses", Str("nobody@refused.example")},
            {"relayHost", relay},
            {"message", Str("m")}}),
  });

  const auto mails = server.mails();
  EXPECT_EQ(server.count(), 4u);
  for (const auto& [recipient, mail] : mails) EXPECT_THAT(recipient, Not(HasSubstr("evil")));

  const Mail& first = mails.at("a@x.com");
  EXPECT_THAT(first.recipients, UnorderedElementsAre("a@x.com", "r@x.com", "c@x.com"));
  EXPECT_EQ(first.from, "admin@x.com");
  EXPECT_EQ(first.headers.at("To"), "a@x.com,=?UTF-8?Q?Ren=C3=A9_Dupont_?=<r@x.com>");
  EXPECT_EQ(first.headers.at("Cc"), "c@x.com");
  EXPECT_EQ(first.body, "Bcc: spy@evil.com\nfrom startup.load\n");

  const Mail& french = mails.at("f@x.com");
  EXPECT_THAT(french.recipients, UnorderedElementsAre("f@x.com", "g@x.com"));
  EXPECT_EQ(french.headers.at("Subject"), "=?UTF-8?Q?Alerte_urgente?=");
  EXPECT_EQ(french.body, "Bonjour startup.load\n");  // SMTP ends the data with a line end
  EXPECT_THAT(mails.at("e@x.com").recipients, ElementsAre("e@x.com"));
  EXPECT_EQ(mails.at("e@x.com").headers.at("Subject"), "Alert");

  const Mail& safe = mails.at("ok@x.com");
  EXPECT_THAT(safe.recipients, ElementsAre("ok@x.com"));
  EXPECT_EQ(safe.from, "<>");  // the null sender
  EXPECT_EQ(safe.headers.count("From"), 0u);
  EXPECT_EQ(safe.headers.count("Bcc"), 0u);
  EXPECT_EQ(safe.headers.at("Subject"), "=?UTF-8?Q?Hi_Bcc=3A_spy3=40evil=2Ecom?=");
  EXPECT_THAT(log, HasSubstr("SendMail: Dropping the address 'victim@x.com\\nBcc: spy@evil.com'"));

  EXPECT_THAT(started->stderrText(), HasSubstr("femail: the relay did not take the mail"));
  EXPECT_THAT(log, HasSubstr("exited with status 1"));
}

TEST_F(MailTest, FemailTakesItsEnvelopeFromTheHeaderBlockOnly) {
  SmtpServer server(dir);
  ASSERT_FALSE(server.address().empty()) << "aiosmtpd did not start";
  const auto femail = [](const std::string& relay, const std::string& input) {
    return RunProgram({"/usr/bin/env", "-i", "SMTPHOST=" + relay, FEMAIL_BINARY_PATH, "-t"}, input);
  };
  const RunResult sent = femail(server.address(),
                                "To: \"Doe, J\" <j@x.com>,\n k@x.com\n"
                                "cc: =?UTF-8?Q?L=C3=A9a?= <l@x.com>\r\n"
                                "From: Admin <adm@x.com>\n"
                                "\r\n"
                                "To: m@x.com\r\n");
  EXPECT_EQ(sent.status, 0) << sent.err;
  const auto mails = server.mails();
  ASSERT_EQ(mails.count("j@x.com"), 1u);
  EXPECT_THAT(mails.at("j@x.com").recipients,
              UnorderedElementsAre("j@x.com", "k@x.com", "l@x.com"));
  EXPECT_EQ(mails.at("j@x.com").from, "adm@x.com");
  EXPECT_EQ(mails.at("j@x.com").body, "To: m@x.com\n");

  const struct {
    std::string relay;
    int status;
    std::string message;
  } failures[] = {
      {"127.0.0.1:1", 1, "femail: the relay did not take the mail: smtp://127.0.0.1:1"},
      {server.address(), 1, "(reply 550)"},
      {"relay/x", 2, "femail: SMTPHOST is not a host or host:port"},
  };
  for (const auto& failure : failures) {
    const RunResult result = femail(failure.relay, "To: a@refused.example\n\nm");
    EXPECT_EQ(result.status, failure.status);
    EXPECT_THAT(result.err, HasSubstr(failure.message));
  }
}

TEST_F(MailTest, LocalModeGivesTheMailProgramItsOptionsAndTheMessage) {
  std::filesystem::create_directories(dir.file("rec"));
  const std::string program = dir.write("mail", Recorder(dir.file("rec")));
  chmod(program.c_str(), 0755);
  runMail(
      {
          Dict({{"type", Str("sendemail")},
                {"recipientAddresses", Str("a@x.com,b@x.com,a@x.com")},
                {"ccAddresses", Str("c@x.com")},
                {"adminEmail", Str("admin@x.com")},
                {"subject", Str("Disk full")},
                {"message", Str("body\n")}}),
          Dict({{"type", Str("sendemail")},
                {"ccAddresses", Str("Ren\xC3\xA9 <r@x.com>")},
                {"message", Str("cc only")}}),
      },
      {{"mailProgram", Str(program)}});
  ASSERT_TRUE(WaitForFiles(dir.file("rec"), 2));
  EXPECT_THAT(FilesIn(dir.file("rec")),
              UnorderedElementsAre(
                  "[-E][-n][-s][=?UTF-8?Q?Disk_full?=][-c][c@x.com][a@x.com,b@x.com]\nbody\n",
                  "[-E][-n][-c][=?UTF-8?Q?Ren=C3=A9_?=<r@x.com>][]\ncc only"));
}

TEST_F(MailTest, BsdMailxHandsTheMailToSendmail) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root for a private mount namespace";
  // bsd-mailx depends on a mail transfer agent; the stand-in is mounted over its sendmail.
  if (!FileExists("/usr/sbin/sendmail")) GTEST_SKIP() << "no /usr/sbin/sendmail to stand in for";
  std::filesystem::create_directories(dir.file("rec"));
  const std::string sendmail = dir.write("sendmail", Recorder(dir.file("rec")));
  chmod(sendmail.c_str(), 0755);
  const std::string pwned = dir.file("pwned");
  const std::string log =
      runMail({Dict({{"type", Str("sendemail")},
                     {"recipientAddresses", Str("a@x.com, b@x.com")},
                     {"ccAddresses", Str("c@x.com")},
                     {"subject", Str("Disk full")},
                     {"message", Str("first\n~! touch " + pwned + "\nlast\n")}})},
              {},
              {"/usr/bin/unshare", "-m", "--propagation", "private", "/bin/sh", "-c",
               "mount --bind " + sendmail + " /usr/sbin/sendmail && exec \"$0\" \"$@\""});
  ASSERT_TRUE(WaitForFiles(dir.file("rec"), 1)) << log << started->stderrText();
  const std::string recorded = FilesIn(dir.file("rec")).at(0);
  EXPECT_THAT(recorded, HasSubstr("To: a@x.com,b@x.com\n"));
  EXPECT_THAT(recorded, HasSubstr("Cc: c@x.com\n"));
  EXPECT_THAT(recorded, HasSubstr("Subject: =?UTF-8?Q?Disk_full?=\n"));
  EXPECT_THAT(recorded, HasSubstr("\n\nfirst\n~! touch " + pwned + "\nlast\n"));
  EXPECT_FALSE(FileExists(pwned));
}

}  // namespace
}  // namespace tarvod::testing
