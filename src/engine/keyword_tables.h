// The operator and action keyword tables: immutable, built once by BuildKeywordTables before
// any rule is loaded and only read afterwards (from any thread).
#pragma once

#include <optional>
#include <string_view>

namespace tarvod {

void BuildKeywordTables();
// The code of a lower-case keyword; nullopt when it is not in the table.
std::optional<int> OperatorCode(std::string_view keyword);
std::optional<int> ActionCode(std::string_view keyword);

}  // namespace tarvod
