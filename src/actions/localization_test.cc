#include "actions/localization.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "platform/testing/log_capture.h"
#include "plist/codec.h"

namespace tarvod {
namespace {

using ::testing::HasSubstr;

TEST(Localization, AddressLanguageComesFromThePrefixThenTheDomainThenEnglish) {
  const struct Case {
    std::string address, language, remaining;
  } cases[] = {
      {"fr:a@x.com", "fr", "a@x.com"},
      {"pt:a@x.de", "pt", "a@x.de"},
      {"abcd:a@x.fr", "fr", "abcd:a@x.fr"},
      {":a@x.de", "de", "a@x.de"},
      {"a@x.COM", "en", "a@x.COM"},
      {"Bob <b@x.fr>", "en", "Bob <b@x.fr>"},
      {"ja:Bob <b@x.fr>", "ja", "Bob <b@x.fr>"},
      {"a@x.jp", "ja", "a@x.jp"},
      {"no", "no", "no"},
      {"", "en", ""},
  };
  for (const Case& c : cases) {
    std::string address = c.address;
    EXPECT_EQ(AddressLanguage(&address), c.language) << c.address;
    EXPECT_EQ(address, c.remaining);
  }
}

class BundleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("LANG", "C", 1);
    unsetenv("LC_MESSAGES");
    // The caches are process-wide: each test has a bundle path of its own.
    bundle_ = capture_.directory() + "/" +
              ::testing::UnitTest::GetInstance()->current_test_info()->name() + ".bundle";
    Write("en.lproj/Localizable.strings",
          "\"Disk full\" = \"Disk full!\";\n\"Only English\" = \"English text\";\n");
    Write("fr.lproj/Localizable.strings",
          *plist::WriteXmlPropertyList(plist::Value(
              plist::Dictionary{{"Disk full", "Disque plein sur ${builtin:hostname}"}})));
    Write("de_DE.lproj/Mail.strings", "\"Disk full\" = \"Platte voll\";");
  }
  void Write(const std::string& name, const std::string& content) {
    const std::filesystem::path path = bundle_ + "/" + name;
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path) << content;
  }

  testing::LogCapture capture_{6};
  std::string bundle_;
};

TEST_F(BundleTest, TranslatesThroughTheMatchingLocalizationAndItsTable) {
  const struct Case {
    std::string text, language, table, result;
  } cases[] = {
      {"Disk full", "fr", "", "Disque plein sur ${builtin:hostname}"},
      {"Disk full", "fr", "Localizable", "Disque plein sur ${builtin:hostname}"},
      {"Disk full", "de", "Mail", "Platte voll"},
      {"Disk full", "en", "", "Disk full!"},
      {"Disk full", "ja", "", "Disk full"},
      {"Only English", "fr", "", "English text"},
      {"Unknown", "fr", "", "Unknown"},
      {"Disk full", "", "", "Disk full"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(LocalizeText(c.text, c.language, bundle_, c.table), c.result)
        << c.language << " " << c.table;
  }
  EXPECT_EQ(LocalizeText("Disk full", "fr", "", ""), "Disk full");
  EXPECT_EQ(LocalizeText("Disk full", "fr", bundle_ + "-missing", ""), "Disk full");
  EXPECT_THAT(capture_.text(), HasSubstr("The bundle at " + bundle_ +
                                         "-missing could not be "
                                         "resolved"));
}

TEST_F(BundleTest, KeepsWhatItReadForTheLifeOfTheProcess) {
  EXPECT_EQ(LocalizeText("Disk full", "de", bundle_, "Mail"), "Platte voll");
  Write("de_DE.lproj/Mail.strings", "\"Disk full\" = \"Neu\";");
  EXPECT_EQ(LocalizeText("Disk full", "de", bundle_, "Mail"), "Platte voll");
  const std::string log = capture_.text();
  EXPECT_TRUE(testing::LinesInOrder(
      log, {"\t\tLocalization Array (preferred) = ", "\t\tLocalization Array (all) = ",
            "\t\tlanguageIdentifier = de localization = de_DE", "\t\t       To: Platte voll",
            "\t\tGetting localization array from the cache",
            "getting localized string ouf of the cache"}))
      << log;

  // The list came from the cache, and the bundle is gone when a new text needs it.
  std::filesystem::remove_all(bundle_);
  EXPECT_EQ(LocalizeText("Other", "de", bundle_, "Mail"), "Other");
  EXPECT_THAT(capture_.text(), HasSubstr("The bundle at " + bundle_ + " could not be loaded"));
}

}  // namespace
}  // namespace tarvod
