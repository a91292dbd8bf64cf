// Against real store files: the tests run as root, as the daemon does.
#include "context/keychain.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <functional>

#include "context/context.h"
#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

std::string Item(const std::string& service, const std::string& account,
                 const std::string& passwordXml) {
  return "<dict><key>service</key><string>" + service + "</string><key>account</key><string>" +
         account + "</string><key>password</key>" + passwordXml + "</dict>";
}

std::string Store(const std::string& items) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><array>" + items +
         "</array></plist>\n";
}

const std::string kRelayPassword = "s3cr3t-Pa55";
const std::string kStore = Store(
    Item("mail.example.com", "relay", "<string>s3cr3t-Pa55</string>") +
    // "dätä-pw" as data, under a non-ASCII account and a server with a port.
    Item("db.example.com:5432", "\xc3\xbcser", "<data>ZMOkdMOkLXB3</data>") +
    Item("bank", "pin", "<string>86420</string>") + Item("broken", "x", "<integer>5</integer>") +
    // Bytes that are no UTF-8.
    Item("binary", "x", "<data>//4=</data>"));

size_t Count(const std::string& text, const std::string& what) {
  size_t count = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) {
    ++count;
  }
  return count;
}

class KeychainTest : public ::testing::Test {
 protected:
  void SetUp() override { write(kStore); }

  // Writes the store in place (same inode) with the mode and owner given.
  void write(const std::string& content, mode_t mode = 0600, uid_t owner = 0) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
    ASSERT_EQ(chmod(path.c_str(), mode), 0);
    ASSERT_EQ(chown(path.c_str(), owner, 0), 0);
  }
  std::optional<plist::Value> lookup(std::string_view reference) {
    return context.variableValueForKey(reference, "/rules.plist");
  }

  testing::LogCapture capture{6};
  const std::string path = capture.directory() + "/system.keychain";
  std::shared_ptr<Keychain> keychain = std::make_shared<Keychain>(path);
  Context context{std::make_shared<VariableStore>(), nullptr, keychain};
};

TEST_F(KeychainTest, FindsPasswordsAndLogsOnlyRealFailures) {
  const struct {
    const char* reference;
    std::optional<std::string> password;
    const char* message;  // logged at level 0, or nullptr for none
  } cases[] = {
      {"keychain:relay@mail.example.com", kRelayPassword, nullptr},
      {"keychain:\xc3\xbcser@db.example.com:5432", "d\xc3\xa4t\xc3\xa4-pw", nullptr},
      {"keychain:nobody@mail.example.com", std::nullopt, nullptr},
      {"keychain:x@binary", std::nullopt, nullptr},
      {"keychain:relay", std::nullopt,
       "ResolveKeychain: Expected keychain address to be user@server not relay\n"},
      {"keychain:a@b@c", std::nullopt,
       "ResolveKeychain: Expected keychain address to be user@server not a@b@c\n"},
      {"keychain:x@broken", std::nullopt,
       "ResolveKeychain: SecKeychainFindGenericPassword fails for user = x server = broken  "
       "result = -26275\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.reference);
    const size_t before = capture.text().size();
    const std::optional<plist::Value> value = lookup(c.reference);
    EXPECT_EQ(value ? std::optional<std::string>(value->string()) : std::nullopt, c.password);
    EXPECT_EQ(capture.text().substr(before), c.message ? c.message : "");
  }
  // A missing password reads as 0 inside text, like any variable without a value.
  ErrorSlot error;
  EXPECT_EQ(context.resolveVariablesInString("x${keychain:nobody@nowhere}", "", &error),
            plist::Value("x0"));
}

TEST_F(KeychainTest, UnopenableStoresYieldNothingAndAreReportedOnce) {
  const std::string good = capture.directory() + "/good.keychain";
  std::ofstream(good) << kStore;
  chmod(good.c_str(), 0600);
  const struct {
    const char* name;
    std::function<void()> make;
    int status;
    std::string reason;
  } cases[] = {
      {"group read", [&] { write(kStore, 0640); }, kKeychainRefused,
       "has group or other permission bits (mode 0640)"},
      {"other read", [&] { write(kStore, 0604); }, kKeychainRefused, "(mode 0604)"},
      {"owned by another user", [&] { write(kStore, 0600, 65534); }, kKeychainRefused,
       "is owned by uid 65534, not by root"},
      {"symbolic link", [&] { std::filesystem::create_symlink(good, path); }, kKeychainRefused,
       "is a symbolic link"},
      {"directory", [&] { std::filesystem::create_directory(path); }, kKeychainRefused,
       "is not a regular file"},
      {"not a property list", [&] { write("service=relay password=x\n"); }, kKeychainInvalid,
       "is not a property-list array"},
      {"a dictionary", [&] { write("<plist><dict/></plist>"); }, kKeychainInvalid,
       "is not a property-list array"},
      {"missing", [] {}, kKeychainNotFound, "cannot be opened: No such file or directory"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    std::filesystem::remove_all(path);
    c.make();
    Context reader(std::make_shared<VariableStore>(), nullptr, std::make_shared<Keychain>(path));
    const size_t before = capture.text().size();
    EXPECT_EQ(reader.variableValueForKey("keychain:relay@mail.example.com", ""), std::nullopt);
    EXPECT_EQ(reader.variableValueForKey("keychain:pin@bank", ""), std::nullopt);
    const std::string logged = capture.text().substr(before);
    EXPECT_EQ(Count(logged, "ResolveKeychain: Can't open system keychain result = " +
                                std::to_string(c.status) + "\n"),
              1u);
    EXPECT_EQ(Count(logged, "ResolveKeychain: " + path), 1u) << logged;
    EXPECT_THAT(logged, HasSubstr(c.reason));
  }
}

TEST_F(KeychainTest, ReadsTheStoreAgainWhenItsInodeOrTimeChangesOrOnForget) {
  auto password = [&] {
    const auto value = lookup("keychain:relay@mail.example.com");
    return value ? value->string() : "(none)";
  };
  EXPECT_EQ(password(), kRelayPassword);

  // New content in place with the old modification time: the cached store still answers.
  struct stat old {};
  ASSERT_EQ(stat(path.c_str(), &old), 0);
  write(Store(Item("mail.example.com", "relay", "<string>second</string>")));
  const timespec times[2] = {old.st_atim, old.st_mtim};
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
  EXPECT_EQ(password(), kRelayPassword);
  keychain->forget();  // what a reload does
  EXPECT_EQ(password(), "second");

  // A new file renamed over the store, again with the old time: a new inode.
  const std::string replacement = path + ".new";
  std::ofstream(replacement) << Store(Item("mail.example.com", "relay", "<string>third</string>"));
  chmod(replacement.c_str(), 0600);
  ASSERT_EQ(utimensat(AT_FDCWD, replacement.c_str(), times, 0), 0);
  ASSERT_EQ(rename(replacement.c_str(), path.c_str()), 0);
  EXPECT_EQ(password(), "third");

  // Permissions are checked at every lookup, not only when the store is read.
  ASSERT_EQ(chmod(path.c_str(), 0644), 0);
  EXPECT_EQ(password(), "(none)");
  ASSERT_EQ(chmod(path.c_str(), 0600), 0);
  EXPECT_EQ(password(), "third");
}

TEST_F(KeychainTest, SecretsAndWhatIsComputedFromThemNeverReachTracesOrDumps) {
  const std::string file = "/rules.plist";
  context.setVariableValue(plist::Value("${keychain:relay@mail.example.com}"), "global:pw", file);
  context.setVariableValue(plist::Value("user relay pass ${keychain:relay@mail.example.com}"),
                           "line", file);
  // Arithmetic and format suffixes make new texts out of a secret: 86420 + 1 and 86420 in hex.
  context.setVariableValue(plist::Value("${keychain:pin@bank} + 1"), "next", file);
  context.setVariableValue(plist::Value("${keychain:pin@bank%x}"), "hex", file);
  context.setVariableValue(plist::Value("copy of ${global:pw}"), "copy", file);
  // A secret as a variable's name, and in a failing substitution's error.
  context.setVariableValue(plist::Value("x"), "${keychain:relay@mail.example.com}", file);
  ErrorSlot error;
  context.resolveVariablesInString("${a${keychain:relay@mail.example.com}", file, &error);
  ASSERT_TRUE(error);
  context.keyExists(kRelayPassword, file);

  // The values themselves are the real ones.
  const VariableStore& store = *context.variables();
  EXPECT_EQ(store.findDictionary(kGlobalsKey)->find("pw")->string(), kRelayPassword);
  EXPECT_EQ(store.findDictionary(file)->find("next")->integerValue(), 86421);
  EXPECT_EQ(store.findDictionary(file)->find("hex")->textForm(), "15194");

  const std::string shown = capture.text() + error->description + context.description();
  for (const std::string& secret :
       {kRelayPassword, std::string("86420"), std::string("86421"), std::string("15194")}) {
    EXPECT_THAT(shown, Not(HasSubstr(secret)));
  }
  EXPECT_THAT(capture.text(), HasSubstr("  Set variable: next = <keychain value>\n"));
  EXPECT_THAT(capture.text(), HasSubstr("  Set variable: <keychain value> = x\n"));
  EXPECT_THAT(context.variablesDescription(), HasSubstr("copy of <keychain value>"));
}

}  // namespace
}  // namespace tarvod
