// The arithmetic assignment rule's evaluator: decimal numbers with optional fraction, binary
// + - * /, unary minus (and plus), parentheses and white space, with the usual precedence.
// Runs in time linear in the input and bounded stack, whatever the input.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "plist/value.h"

namespace tarvod {

struct ArithmeticResult {
  std::optional<plist::Value> value;  // an integer when integral and in range, else a real
  std::string failure;                // why evaluation failed, when value is nullopt
};

ArithmeticResult EvaluateArithmetic(std::string_view expression);

// True when the text holds at least one decimal digit and only characters of
// "0123456789. \t\n+-/*()": the texts that assignment hands to the evaluator.
bool IsArithmeticCandidate(std::string_view text);

}  // namespace tarvod
