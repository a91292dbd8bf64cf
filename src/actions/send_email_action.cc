#include "actions/send_email_action.h"

#include <chrono>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "actions/localization.h"
#include "platform/diagnostic_log.h"
#include "platform/serial_queue.h"

namespace tarvod {
namespace {

constexpr int kMaxNestingLevel = 5;
constexpr size_t kShortMessageBytes = 159;
// Only the first six characters of an entry can hold a language prefix and its colon.
constexpr size_t kPrefixColonRange = 6;
constexpr std::string_view kSafeCharacters =
    "!*+-/=_0123456789abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";

bool IsTrimmed(char c) {
  return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f';
}

std::string Trimmed(std::string_view text) {
  while (!text.empty() && IsTrimmed(text.front())) text.remove_prefix(1);
  while (!text.empty() && IsTrimmed(text.back())) text.remove_suffix(1);
  return std::string(text);
}

// "\:" becomes ":" where both characters lie within the first six.
std::string UnescapePrefixColon(const std::string& text) {
  const size_t range = std::min(text.size(), kPrefixColonRange);
  std::string out;
  size_t i = 0;
  for (; i < text.size(); ++i) {
    if (i + 1 < range && text[i] == '\\' && text[i + 1] == ':') {
      out += ':';
      ++i;
    } else {
      out += text[i];
    }
  }
  return out;
}

void Flatten(const plist::Array& list, int level, std::vector<std::string>* out) {
  if (level == kMaxNestingLevel) {
    LogMessage(1,
               "Ignoring additional email addresses because there are too many levels of nesting");
    return;
  }
  for (const plist::Value& element : list) {
    if (element.isArray()) {
      Flatten(element.array(), level + 1, out);
    } else if (element.isString()) {
      const std::string& text = element.string();
      size_t start = 0;
      for (;;) {
        const size_t comma = text.find(',', start);
        const std::string_view piece = std::string_view(text).substr(
            start, comma == std::string::npos ? std::string::npos : comma - start);
        out->push_back(UnescapePrefixColon(Trimmed(piece)));
        if (comma == std::string::npos) break;
        start = comma + 1;
      }
    }
  }
}

std::string Joined(const std::vector<std::string>& items, std::string_view separator) {
  std::string out;
  for (size_t i = 0; i < items.size(); ++i) {
    if (i != 0) out += separator;
    out += items[i];
  }
  return out;
}

// The text with its line breaks shown as \r and \n, for a log line that names it.
std::string Shown(const std::string& text) {
  std::string out;
  for (const char c : text) {
    if (c == '\r') {
      out += "\\r";
    } else if (c == '\n') {
      out += "\\n";
    } else {
      out += c;
    }
  }
  return out;
}

// The part of an address that reaches a header or a command line unencoded: from the last
// "<" on, or all of it.
std::string_view RawPart(std::string_view address) {
  const size_t angle = address.rfind('<');
  return angle == std::string_view::npos ? address : address.substr(angle);
}

// An address whose unencoded part holds a line break would end its header line and start
// another (a forged Bcc, a second message); in local mode one that begins with "-" would be
// read as an option of the mail command. Such addresses are dropped and named.
std::vector<std::string> SafeAddresses(const std::vector<std::string>& addresses, bool local) {
  std::vector<std::string> safe;
  for (const std::string& address : addresses) {
    if (RawPart(address).find_first_of("\r\n") != std::string_view::npos) {
      LogMessage(0, "SendMail: Dropping the address '%s': it holds a line break",
                 Shown(address).c_str());
    } else if (local && !address.empty() && address.front() == '-') {
      LogMessage(0,
                 "SendMail: Dropping the address '%s': the mail command would read it as an "
                 "option",
                 address.c_str());
    } else {
      safe.push_back(address);
    }
  }
  return safe;
}

std::vector<std::string> Encoded(const std::vector<std::string>& addresses) {
  std::vector<std::string> out;
  out.reserve(addresses.size());
  for (const std::string& address : addresses) out.push_back(EncodedAddress(address));
  return out;
}

std::string Quoted(const std::vector<std::string>& arguments) {
  std::string out;
  for (const std::string& argument : arguments) {
    if (!out.empty()) out += ' ';
    out += '"' + argument + '"';
  }
  return out;
}

// The text of a key resolved through the rule file's and then the global variable of the
// same name, as the relay host and the sender are; errors count as no value.
std::string ResolvedSetting(const plist::Dictionary& action, const std::string& key,
                            const FiredRule& rule, Context& context) {
  const auto resolve = [&](const std::string& text) -> std::optional<std::string> {
    ErrorSlot error;
    const std::optional<plist::Value> value =
        context.resolveVariablesInString(text, rule.filePath, &error);
    if (error || !value) return std::nullopt;
    return value->textForm();
  };
  const plist::Value* value = action.find(key);
  std::optional<std::string> text = resolve(value ? value->textForm() : "${" + key + "}");
  if (!text) text = resolve("${global:" + key + "}");
  return text.value_or("");
}

// A recipient list: a string wrapped in an array, then resolved. The outer nullopt aborts
// the action after its message.
std::optional<plist::Array> RecipientList(const plist::Dictionary& action, const char* key,
                                          const FiredRule& rule, Context& context) {
  const plist::Value* value = action.find(key);
  if (value == nullptr) return plist::Array();
  plist::Array list;
  if (value->isString()) {
    list.push_back(*value);
  } else if (value->isArray()) {
    list = value->array();
  } else {
    LogMessage(0, "The %s key is not an array in the action:\n%s", key,
               context.shownValue(plist::Value(action)).c_str());
    return std::nullopt;
  }
  ErrorSlot error;
  std::optional<plist::Value> resolved =
      context.resolveVariablesInArray(list, rule.filePath, &error);
  if (error) {
    LogMessage(0, "Error: %s", error->description.c_str());
    return std::nullopt;
  }
  if (!resolved || !resolved->isArray()) return plist::Array();
  return resolved->array();
}

using LanguageGroups = std::map<std::string, std::vector<std::string>>;

LanguageGroups GroupByLanguage(const std::vector<std::string>& addresses) {
  LanguageGroups groups;
  for (std::string address : addresses) {
    const std::string language = AddressLanguage(&address);
    groups[language].push_back(std::move(address));
  }
  return groups;
}

// The text of message or subject for one language: localized when it is a string and a
// bundle is named, resolved and colon-unescaped. The outer nullopt aborts the action; an
// absent key gives an absent text.
std::optional<std::optional<std::string>> LocalizedText(
    const plist::Dictionary& action, const char* key, const std::string& language,
    const std::string& bundle, const std::string& table, const FiredRule& rule, Context& context) {
  const plist::Value* value = action.find(key);
  if (value == nullptr) return std::optional<std::string>();
  std::string text = value->textForm();
  if (value->isString() && !bundle.empty()) text = LocalizeText(text, language, bundle, table);
  ErrorSlot error;
  const std::optional<plist::Value> resolved =
      context.resolveVariablesInString(text, rule.filePath, &error);
  if (error) {
    LogMessage(0, "Error: %s", error->description.c_str());
    return std::nullopt;
  }
  if (!resolved) return std::optional<std::string>();
  return std::optional<std::string>(UnescapeColonsInString(resolved->textForm()));
}

std::string StringKey(const plist::Dictionary& action, const char* key) {
  const plist::Value* value = action.find(key);
  return value ? value->textForm() : std::string();
}

}  // namespace

std::vector<std::string> FlattenRecipients(const plist::Array& list) {
  std::vector<std::string> out;
  Flatten(list, 0, &out);
  return out;
}

std::string ShortMessageBody(std::string_view message) {
  size_t length = std::min(message.size(), kShortMessageBytes);
  // Back to the start of a character: continuation bytes are 10xxxxxx.
  if (length < message.size()) {
    while (length > 0 && (static_cast<unsigned char>(message[length]) & 0xC0) == 0x80) --length;
  }
  return std::string(message.substr(0, length)) + "\n";
}

std::vector<std::string> RemoveRepeatedAddresses(const std::vector<std::string>& addresses) {
  std::vector<std::string> out;
  std::set<std::string> seen;
  for (const std::string& address : addresses) {
    if (seen.insert(address).second) out.push_back(address);
  }
  return out;
}

std::string EncodedWord(std::string_view text) {
  if (text.find_first_not_of(kSafeCharacters) == std::string_view::npos) return std::string(text);
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out = "=?UTF-8?Q?";
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if ((byte >= 'a' && byte <= 'z') || (byte >= 'A' && byte <= 'Z') ||
        (byte >= '0' && byte <= '9') || byte == '!' || byte == '*' || byte == '+' || byte == '-' ||
        byte == '/') {
      out += c;
    } else if (byte == ' ' || byte == '\n') {
      out += '_';
    } else {
      out += '=';
      out += kHex[byte >> 4];
      out += kHex[byte & 0x0F];
    }
  }
  return out + "?=";
}

std::string EncodedAddress(std::string_view address) {
  const size_t angle = address.rfind('<');
  if (angle == std::string_view::npos) return std::string(address);
  return EncodedWord(address.substr(0, angle)) + std::string(address.substr(angle));
}

void SendEmailAction::setPrograms(MailPrograms programs) {
  std::lock_guard<std::mutex> lock(mProgramsLock);
  mPrograms = std::move(programs);
}

std::optional<std::vector<SendEmailAction::Mail>> SendEmailAction::mails(
    const plist::Dictionary& action, const FiredRule& rule, Context& context) const {
  const std::optional<plist::Array> to = RecipientList(action, "recipientAddresses", rule, context);
  if (!to) return std::nullopt;
  const std::optional<plist::Array> cc = RecipientList(action, "ccAddresses", rule, context);
  if (!cc) return std::nullopt;
  std::vector<Mail> mails;
  if (to->empty() && cc->empty()) {
    LogMessage(3, "Skipping sending mail message because there are no recipients\n%s",
               context.shownValue(plist::Value(action)).c_str());
    return mails;
  }
  const std::string relayHost = ResolvedSetting(action, "relayHost", rule, context);
  const std::string sender = ResolvedSetting(action, "adminEmail", rule, context);

  const LanguageGroups toGroups = GroupByLanguage(FlattenRecipients(*to));
  const LanguageGroups ccGroups = GroupByLanguage(FlattenRecipients(*cc));
  std::set<std::string> languages;
  for (const auto& [language, addresses] : toGroups) languages.insert(language);
  for (const auto& [language, addresses] : ccGroups) languages.insert(language);

  const std::string bundle = StringKey(action, "localizationBundlePath");
  const std::string table = StringKey(action, "localizationTable");
  for (const std::string& language : languages) {
    LogMessage(3, "\tProcessing language %s using bundle %s and table %s", language.c_str(),
               bundle.c_str(), table.c_str());
    const auto message = LocalizedText(action, "message", language, bundle, table, rule, context);
    if (!message) return std::nullopt;
    Mail mail;
    mail.message = message->value_or("");
    if (mShortMessage) {
      mail.message = ShortMessageBody(mail.message);
    } else {
      const auto subject = LocalizedText(action, "subject", language, bundle, table, rule, context);
      if (!subject) return std::nullopt;
      mail.subject = *subject;
    }
    if (const auto found = toGroups.find(language); found != toGroups.end())
      mail.to = found->second;
    if (const auto found = ccGroups.find(language); found != ccGroups.end())
      mail.cc = found->second;
    mail.sender = sender;
    mail.relayHost = relayHost;
    mails.push_back(std::move(mail));
  }
  return mails;
}

int SendEmailAction::send(const plist::Dictionary& action, const FiredRule& rule,
                          Context& context) {
  std::optional<std::vector<Mail>> mails = this->mails(action, rule, context);
  if (!mails) return 1;
  int result = 0;
  for (Mail& mail : *mails) {
    const int status = submit(std::move(mail), context);
    if (status != 0) result = status;
  }
  return result;
}

std::optional<std::string> SendEmailAction::describe(const plist::Dictionary& action,
                                                     const FiredRule& rule, Context& context) {
  const std::optional<std::vector<Mail>> mails = this->mails(action, rule, context);
  if (!mails) return std::nullopt;
  if (mails->empty()) return std::string("would send nothing: there are no recipients");
  std::string out;
  for (const Mail& mail : *mails) {
    if (!out.empty()) out += "\n    ";
    out += "would mail " + Joined(RemoveRepeatedAddresses(mail.to), ", ");
    if (!mail.cc.empty()) out += " (Cc " + Joined(RemoveRepeatedAddresses(mail.cc), ", ") + ")";
    out += mail.relayHost.empty() ? " with the local mail program"
                                  : " through the relay host " + mail.relayHost;
    if (!mail.relayHost.empty() && !mail.sender.empty()) out += " from " + mail.sender;
    if (mail.subject) out += ", subject \"" + *mail.subject + "\"";
    out += ": " + mail.message;
  }
  return context.shownText(out);
}

int SendEmailAction::submit(Mail mail, const Context& context) {
  const bool relay = !mail.relayHost.empty();
  mail.to = SafeAddresses(RemoveRepeatedAddresses(mail.to), !relay);
  mail.cc = SafeAddresses(RemoveRepeatedAddresses(mail.cc), !relay);
  if (mail.sender.find_first_of("\r\n") != std::string::npos) {
    LogMessage(0, "SendMail: Dropping the sender '%s': it holds a line break",
               Shown(mail.sender).c_str());
    mail.sender.clear();
  }
  if (mail.to.empty() && mail.cc.empty()) {
    LogMessage(3, "    Skipping sending message because there are no recipients.");
    return 0;
  }
  const std::vector<std::string> to = Encoded(mail.to);
  const std::vector<std::string> cc = Encoded(mail.cc);

  LaunchRequest request;
  std::string headers;
  {
    std::lock_guard<std::mutex> lock(mProgramsLock);
    request.program = relay ? mPrograms.relay : mPrograms.local;
  }
  std::vector<std::string> arguments;
  if (relay) {
    arguments = {"-t"};
    if (!to.empty()) headers += "To: " + Joined(to, ",") + "\n";
    if (!cc.empty()) headers += "Cc: " + Joined(cc, ",") + "\n";
    if (mail.subject && !mail.subject->empty()) {
      headers += "Subject: " + EncodedWord(*mail.subject) + "\n";
    }
    if (!mail.sender.empty()) headers += "From: " + mail.sender + "\n";
    request.environment = std::vector<std::string>{"SMTPHOST=" + mail.relayHost};
  } else {
    arguments = {"-E", "-n"};
    if (mail.subject) {
      arguments.push_back("-s");
      arguments.push_back(EncodedWord(*mail.subject));
    }
    if (!cc.empty()) {
      // "-c": the mail command would read "-cc" as "-c" with the value "c".
      arguments.push_back("-c");
      arguments.push_back(Joined(cc, ","));
    }
    arguments.push_back(Joined(to, ","));
  }

  // A value from the keychain may be anywhere in these: the traces show it masked.
  if (DebugLevel() > 3) {
    LogMessage(4, "    Recipients: %s", context.shownText(Joined(to, ", ")).c_str());
    LogMessage(4, "    CC'd Recipients: %s", context.shownText(Joined(cc, ", ")).c_str());
    LogMessage(4, "    Relay Host: %s", context.shownText(mail.relayHost).c_str());
    LogMessage(4, "    Admin EMail: %s", context.shownText(mail.sender).c_str());
    LogMessage(4, "    Headers: %s", context.shownText(headers).c_str());
  }
  if (DebugLevel() >= 5) {
    LogMessage(5, "    Mail command:\n      %s %s", request.program.c_str(),
               context.shownText(Quoted(arguments)).c_str());
  }

  request.arguments.push_back(request.program);
  request.arguments.insert(request.arguments.end(), arguments.begin(), arguments.end());
  // The empty line ends the header block, so that a message whose first line looks like a
  // header stays message text.
  request.input = headers.empty() ? mail.message : headers + "\n" + mail.message;
  request.redirections[0].failure =
      ChildMessage{"SendMail (child): Redirect of stdin failed errno = ", true};
  request.redirections[1].descriptor = 1;
  request.redirections[2].descriptor = 2;
  request.execFailure =
      ChildMessage{"SendMail (child): Can't execute " + request.program + " errno = ", true};
  const double limit = mTimeout.load();
  request.inputSeconds = limit;

  // A program that hangs must not keep shutdown from saving state.
  SerialQueue::BlockingSection blocking;
  const auto started = std::chrono::steady_clock::now();
  Result<ChildProcess> child = mLauncher.launch(request);
  if (!child.ok()) {
    LogMessage(0, "SendMail: Can't start %s: %s failed errno = %d", request.program.c_str(),
               child.status().what().c_str(), child.status().error());
    return 1;
  }
  if (!child.value().input.ok()) {
    LogMessage(0, "SendMail: %s took %zu of %zu bytes of the mail (%s errno = %d)",
               request.program.c_str(), child.value().inputWritten, request.input->size(),
               child.value().input.what().c_str(), child.value().input.error());
  }
  std::optional<double> left;
  if (limit > 0) {
    const std::chrono::duration<double> spent = std::chrono::steady_clock::now() - started;
    left = std::max(0.0, limit - spent.count());
  }
  const ExitStatus status =
      WaitOrEnd(mLauncher, child.value(), left, "SendMail", request.program, limit);
  LogMessage(3, "SendMail: %s exited with status %d", request.program.c_str(), status);
  return status;
}

}  // namespace tarvod
