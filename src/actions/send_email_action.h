// The "sendemail", "sendpage" and "sendsms" actions: a message to To and Cc recipients,
// grouped by language with one mail per language, handed to a mail program through a pipe:
// the relay helper (headers written here, SMTPHOST in its environment) when a relay host is
// set, else the local mail command (options on its command line). Runs on the processing
// queue and waits for each program, at most the command time limit when one is set; failures
// are logged and end only the action.
#pragma once

#include <atomic>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "actions/action.h"
#include "platform/process_launcher.h"

namespace tarvod {

struct MailPrograms {
  std::string local = "/usr/bin/mail";
  std::string relay = "/usr/libexec/tarvod/femail";
};

class SendEmailAction final : public Action {
 public:
  // shortMessage: the pager and text-message form, without subject and cut to 160 bytes.
  SendEmailAction(ProcessLauncher& launcher, bool shortMessage)
      : mLauncher(launcher), mShortMessage(shortMessage) {}
  void perform(const plist::Dictionary& action, const FiredRule& rule, Context& context) override {
    send(action, rule, context);
  }
  // 0: nothing sent or every program exited with 0; 1: the action was aborted; otherwise the
  // last non-zero status of a mail program.
  int send(const plist::Dictionary& action, const FiredRule& rule, Context& context);
  // The recipients, sender, subject and message of each mail it would send.
  std::optional<std::string> describe(const plist::Dictionary& action, const FiredRule& rule,
                                      Context& context) override;

  // Any thread.
  void setPrograms(MailPrograms programs);
  // Seconds a mail program may take, its input included; 0: no limit.
  void setTimeout(double seconds) { mTimeout.store(seconds); }

 private:
  struct Mail {
    std::vector<std::string> to;
    std::vector<std::string> cc;
    std::string sender;
    std::optional<std::string> subject;
    std::string message;
    std::string relayHost;
  };
  // One mail per language; nullopt when the action is aborted (logged).
  std::optional<std::vector<Mail>> mails(const plist::Dictionary& action, const FiredRule& rule,
                                         Context& context) const;
  // context only shows the traces with keychain passwords masked.
  int submit(Mail mail, const Context& context);

  ProcessLauncher& mLauncher;
  const bool mShortMessage;
  std::mutex mProgramsLock;
  MailPrograms mPrograms;
  std::atomic<double> mTimeout{0};
};

// The steps of the action, for its tests.

// Nested lists of comma-separated addresses as one flat list of trimmed addresses, with
// "\:" turned into ":" within the first six characters; lists nested five deep are skipped.
std::vector<std::string> FlattenRecipients(const plist::Array& list);
// At most 159 bytes of message, cut between whole UTF-8 characters, then a newline.
std::string ShortMessageBody(std::string_view message);
// The first occurrence of each address, in order.
std::vector<std::string> RemoveRepeatedAddresses(const std::vector<std::string>& addresses);
// The text unchanged when it holds only safe characters, else one RFC 2047 "Q" encoded word.
std::string EncodedWord(std::string_view text);
// The display name before the last "<" as an encoded word, the rest unchanged.
std::string EncodedAddress(std::string_view address);

}  // namespace tarvod
