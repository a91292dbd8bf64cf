#include "engine/keyword_tables.h"

#include <map>
#include <mutex>
#include <string>

namespace tarvod {
namespace {

using KeywordTable = std::map<std::string, int, std::less<>>;

// Code 1 is not assigned.
const KeywordTable& OperatorTable() {
  static const KeywordTable table = {
      {"true", 0},
      {"equal", 2},
      {"greaterthan", 3},
      {"lessthan", 4},
      {"greaterthanequal", 5},
      {"lessthanequal", 6},
      {"notequal", 7},
      {"groupmember", 8},
      {"notgroupmember", 9},
      {"beginswith", 10},
      {"endswith", 11},
      {"contains", 12},
      {"notcontains", 13},
      {"sortsbefore", 14},
      {"sortsafter", 15},
      {"defined", 16},
      {"notdefined", 17},
      {"empty", 18},
      {"notempty", 19},
  };
  return table;
}

// Codes 1 and 2 are not assigned.
const KeywordTable& ActionTable() {
  static const KeywordTable table = {
      {"nullaction", 0},  {"log", 3},         {"sendemail", 4},
      {"sendmessage", 5}, {"sendqe", 6},      {"postnotification", 7},
      {"sendpage", 8},    {"sendsms", 9},     {"runcommand", 10},
      {"addtodb", 11},    {"publishrss", 12}, {"debugdump", 13},
  };
  return table;
}

std::optional<int> Find(const KeywordTable& table, std::string_view keyword) {
  auto it = table.find(keyword);
  if (it == table.end()) return std::nullopt;
  return it->second;
}

}  // namespace

void BuildKeywordTables() {
  static std::once_flag once;
  std::call_once(once, [] {
    OperatorTable();
    ActionTable();
  });
}

std::optional<int> OperatorCode(std::string_view keyword) { return Find(OperatorTable(), keyword); }

std::optional<int> ActionCode(std::string_view keyword) { return Find(ActionTable(), keyword); }

}  // namespace tarvod
