// A rules file: loaded into a rulebase through the engine, as the daemon loads one, then every
// rule run against an event of each type it names. Actions are taken out first: a log action
// would append to any path the input names.
#include <fcntl.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <string>

#include "engine/engine.h"
#include "platform/diagnostic_log.h"
#include "platform/structured_log.h"
#include "platform/testing/fake_clock.h"
#include "plist/codec.h"

namespace {

// Types run per input, so that one input cannot queue unbounded work.
constexpr size_t kMaxTypes = 16;

std::string Setup() {
  const int fd = open("/dev/null", O_WRONLY | O_APPEND | O_CLOEXEC);
  if (fd >= 0) tarvod::AttachErrorLog(fd);
  tarvod::SetDebugLevel(3);
  tarvod::ConfigureStructuredLog("/dev/null");
  char pattern[] = "/tmp/tarvod-rules-fuzz-XXXXXX";
  return std::string(mkdtemp(pattern) ? pattern : "/tmp") + "/rules.plist";
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const std::string path = Setup();
  std::optional<plist::Value> file =
      plist::ReadPropertyList(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!file) return 0;
  if (plist::Array* rules = file->asArray()) {
    for (plist::Value& rule : *rules) {
      if (plist::Dictionary* dictionary = rule.asDictionary()) {
        dictionary->erase("actions");
        dictionary->erase("loadVariablesFromFile");
        dictionary->erase("loadVariablesWithRule");
      }
    }
  }
  const std::optional<std::string> xml = plist::WriteXmlPropertyList(*file);
  if (!xml) return 0;
  const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) return 0;
  const bool written = write(fd, xml->data(), xml->size()) == static_cast<ssize_t>(xml->size());
  close(fd);
  if (!written) return 0;

  tarvod::FakeClock clock(1000);
  tarvod::Engine engine(clock, plist::Dictionary{{"count", plist::Value::Integer(1)}});
  size_t count = 0;
  tarvod::RulebasePtr rulebase = engine.loadRules(path, &count);
  engine.swapRulebase(rulebase);
  size_t types = 0;
  for (const auto& [type, entry] : *rulebase) {
    if (++types > kMaxTypes) break;
    engine.dispatchEvent(plist::Dictionary{
        {"eventType", plist::Value(type)},
        {"eventDetails", plist::Dictionary{{"clientIP", "192.0.2.7"}, {"user", "root"}}}});
  }
  engine.drain(60);
  return 0;
}
