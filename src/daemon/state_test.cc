// Saved state: the merge at startup, the state/state_temp/state_prev files of each save and
// what every failure leaves on disk (in memory, with FakeFiles), then the real file system:
// a save killed at any instant, and a full disk.
#include "daemon/state.h"

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <random>

#include "platform/testing/fake_clock.h"
#include "platform/testing/fake_files.h"
#include "platform/testing/log_capture.h"
#include "plist/codec.h"

namespace tarvod {
namespace {

using plist::Dictionary;
using plist::Value;

constexpr const char* kDir = "/state";

Dictionary Config(int saveState = 1, const std::string& directory = kDir) {
  return Dictionary{{"saveState", Value::Integer(saveState)}, {"stateDirectory", directory}};
}

std::string Xml(const Dictionary& dictionary) {
  return *plist::WriteXmlPropertyList(Value(dictionary));
}

Dictionary Parsed(const std::string& bytes) {
  std::optional<Value> value = plist::ReadPropertyList(bytes);
  return value && value->isDictionary() ? value->dictionary() : Dictionary{};
}

class StateTest : public ::testing::Test {
 protected:
  void set(const char* file, const char* name, Value value) {
    engine_.withVariables([&](VariableStore& store) {
      Dictionary locals = store.findDictionary(file) ? *store.findDictionary(file) : Dictionary{};
      locals.set(name, std::move(value));
      store.set(file, Value(std::move(locals)));
    });
  }
  Dictionary store() {
    Dictionary copy;
    engine_.withVariables([&](VariableStore& store) { copy = store; });
    return copy;
  }
  std::string file(const char* name) { return files_.files[std::string(kDir) + "/" + name]; }
  bool has(const char* name) { return files_.exists(std::string(kDir) + "/" + name); }

  testing::LogCapture capture_{1};
  FakeClock clock_;
  Engine engine_{clock_, Dictionary{{"g", "initial"}}};
  FakeFiles files_;
};

TEST_F(StateTest, SavesReplaceStateAndKeepTheReplacedCopyAsStatePrev) {
  set("/rules/a.plist", "n", Value::Integer(1));
  SaveState(Config(), engine_, files_);
  EXPECT_TRUE(files_.directories.contains(kDir));
  const std::string first = file("state");
  EXPECT_EQ(Parsed(first), store());
  EXPECT_FALSE(has("state_temp"));
  EXPECT_FALSE(has("state_prev"));

  files_.files[std::string(kDir) + "/state_prev"] = "stale";
  set("/rules/a.plist", "n", Value::Integer(2));
  SaveState(Config(), engine_, files_);
  EXPECT_EQ(file("state_prev"), first);
  EXPECT_EQ(Parsed(file("state")), store());
  EXPECT_FALSE(has("state_temp"));
  EXPECT_EQ(capture_.text(), "");
}

TEST_F(StateTest, RestoreMergesWholeEntriesAndTheStoreWins) {
  files_.files[std::string(kDir) + "/state"] =
      Xml(Dictionary{{"_globals", Dictionary{{"g", "saved"}, {"h", "saved"}}},
                     {"/rules/a.plist", Dictionary{{"n", Value::Integer(7)}}}});
  RestoreState(Config(), engine_, files_);
  const Dictionary restored = store();
  EXPECT_EQ(*restored.findDictionary("_globals"), (Dictionary{{"g", "initial"}}));
  EXPECT_EQ(*restored.findDictionary("/rules/a.plist"), (Dictionary{{"n", Value::Integer(7)}}));
}

// saveState 0 only creates the directory; a file not wholly the daemon's own is ignored.
TEST_F(StateTest, RestoresNothingWhenOffOrFromAFileNotWhollyOurs) {
  const Dictionary before = store();
  const std::string path = std::string(kDir) + "/state";
  files_.files[path] = Xml(Dictionary{{"/rules/b", Dictionary{}}});
  RestoreState(Config(0), engine_, files_);
  EXPECT_EQ(store(), before);
  SaveState(Config(0), engine_, files_);
  EXPECT_TRUE(files_.directories.contains(kDir));
  EXPECT_EQ(files_.files.size(), 1u);

  for (const std::string& bytes : {*plist::WriteXmlPropertyList(Value(plist::Array{Value("x")})),
                                   std::string("not a property list"), std::string()}) {
    files_.files[path] = bytes;
    RestoreState(Config(), engine_, files_);
    EXPECT_EQ(store(), before);
  }
  files_.files[path] = Xml(Dictionary{{"/rules/b", Dictionary{}}});
  files_.foreign.insert(path);
  RestoreState(Config(), engine_, files_);
  EXPECT_EQ(store(), before);
  EXPECT_EQ(capture_.text(), "");
}

TEST_F(StateTest, AnUnserialisableStoreFailsWholeAndKeepsThePreviousFile) {
  files_.files[std::string(kDir) + "/state"] = "previous";
  set("/rules/a.plist", "bad", Value(std::string("nul\0inside", 10)));
  SaveState(Config(), engine_, files_);
  EXPECT_EQ(file("state"), "previous");
  EXPECT_EQ(capture_.text(), "Failed to prepare the state data for saving\n");
}

TEST_F(StateTest, EveryFailedStepLeavesACompleteStateFile) {
  const std::string dir = std::string(kDir) + "/";
  struct Case {
    const char* op;
    const char* path;
    const char* temp;  // what state_temp holds afterwards: "" none, "new" the new copy
  };
  for (const Case& c : {Case{"write", "state_temp", ""}, Case{"link", "state", "new"},
                        Case{"rename", "state_temp", "new"}, Case{"write", "state", ""}}) {
    SCOPED_TRACE(std::string(c.op) + " " + c.path);
    FakeFiles files;
    const bool first = std::string(c.op) == "write" && std::string(c.path) == "state";
    if (!first) files.files[dir + "state"] = "old";
    files.failOn(c.op, dir + c.path);
    SaveState(Config(), engine_, files);
    EXPECT_EQ(files.files.contains(dir + "state") ? files.files[dir + "state"] : "none",
              first ? "none" : "old");
    EXPECT_EQ(files.files.contains(dir + "state_temp"), *c.temp != '\0');
  }
  std::string expected;
  for (int i = 0; i < 4; ++i) expected += "Failed to save the state data\n";
  EXPECT_EQ(capture_.text(), expected);
}

// A child saves a growing store over and over on the real file system; it is killed at a
// random instant, and "state" must then parse whole and hold one of the saves.
TEST(StateOnDisk, AKilledSaveAlwaysLeavesACompleteStateFile) {
  testing::LogCapture capture(0);
  const std::string dir = capture.directory() + "/state";
  std::mt19937 random(12345);
  int64_t lastSeen = -1;
  for (int round = 0; round < 200; ++round) {
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      FakeClock clock;
      // A large value so that each save takes long enough to be cut in the middle.
      Engine engine(clock, Dictionary{{"padding", std::string(256 * 1024, 'p')}});
      for (int64_t n = 0;; ++n) {
        engine.withVariables([&](VariableStore& store) {
          store.set("/rules/a.plist", Value(Dictionary{{"n", Value::Integer(n)}}));
        });
        SaveState(Config(1, dir), engine, Files::Real());
      }
    }
    usleep(std::uniform_int_distribution<useconds_t>(1000, 20000)(random));
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    Result<std::string> bytes = Files::Real().readOwnedFile(dir + "/state");
    if (!bytes.ok()) {
      ASSERT_EQ(lastSeen, -1) << "state vanished after round " << round;
      continue;  // killed before the first save finished
    }
    const Dictionary saved = Parsed(bytes.value());
    ASSERT_NE(saved.findDictionary("/rules/a.plist"), nullptr) << "round " << round;
    lastSeen = saved.findDictionary("/rules/a.plist")->find("n")->integerValue();
  }
  EXPECT_GE(lastSeen, 0);
}

// A tmpfs too small for the new copy, in a private mount namespace (root only).
TEST(StateOnDisk, AFullDiskKeepsTheOldCopy) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root";
  testing::LogCapture capture(1);
  const std::string dir = capture.directory() + "/small";
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) ||
        mkdir(dir.c_str(), 0700) != 0 || mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=64k")) {
      _exit(2);
    }
    FakeClock clock;
    Engine engine(clock, Dictionary{{"small", "x"}});
    SaveState(Config(1, dir), engine, Files::Real());
    const std::string old = Files::Real().readOwnedFile(dir + "/state").value();
    engine.withVariables([](VariableStore& store) {
      store.set("/big", Value(Dictionary{{"v", std::string(128 * 1024, 'b')}}));
    });
    SaveState(Config(1, dir), engine, Files::Real());
    const Result<std::string> now = Files::Real().readOwnedFile(dir + "/state");
    _exit(now.ok() && now.value() == old ? 0 : 1);
  }
  int status = 0;
  waitpid(child, &status, 0);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(capture.text(), "Failed to save the state data\n");
}

}  // namespace
}  // namespace tarvod
