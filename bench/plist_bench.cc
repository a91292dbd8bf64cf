// Time and peak memory of reading the worst 1 MiB inputs (the event packet limit) that the
// property-list readers accept or must refuse. The peak is the rise of the process's resident
// high-water mark during one read, reported per input byte; it covers the pre-check, any
// intermediate tree (libplist's, for XML) and the value together.
#include <benchmark/benchmark.h>
#include <malloc.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "plist/codec.h"

namespace plist {
namespace {

constexpr size_t kInputSize = 1024 * 1024;

std::string BigEndian(uint64_t value, size_t size) {
  std::string out(size, '\0');
  for (size_t i = 0; i < size; ++i) out[size - 1 - i] = static_cast<char>(value >> (8 * i));
  return out;
}

// A binary list with one-byte references: the top container (0xA array or 0xD dictionary)
// refers `references` times to object 1, which is `leaf`. One-byte references give the most
// nodes per input byte.
std::string SharedLeafList(uint8_t container, size_t references, const std::string& leaf) {
  const size_t count = container == 0xD ? references / 2 : references;
  std::string out = "bplist00";
  out += std::string(1, static_cast<char>(container << 4 | 0x0F)) + "\x13" + BigEndian(count, 8);
  out += std::string(references, '\x01');
  const uint64_t leafOffset = out.size();
  out += leaf;
  const uint64_t table = out.size();
  out += BigEndian(8, 4) + BigEndian(leafOffset, 4);
  return out + std::string(6, '\0') + "\x04\x01" + BigEndian(2, 8) + BigEndian(0, 8) +
         BigEndian(table, 8);
}

// The references that bring a shared leaf list to about kInputSize bytes.
size_t ReferencesFor(const std::string& leaf) { return kInputSize - 64 - leaf.size(); }

std::string AsciiString(size_t length) {
  return std::string(1, static_cast<char>(0x50 | length)) + std::string(length, 's');
}

// Shared payloads near the edge of the expansion budget: a 14-byte string (the longest whose
// length fits in its marker) referenced from every byte is 14 bytes of payload per input byte,
// within the factor of 16.
std::string ArrayOfSharedStrings() {
  return SharedLeafList(0xA, ReferencesFor(AsciiString(14)), AsciiString(14));
}
std::string DictionaryOfSharedStrings() {
  return SharedLeafList(0xD, ReferencesFor(AsciiString(14)), AsciiString(14));
}
// Strings just too long to live inside a std::string, so each copy is a heap block too:
// 16 bytes of payload per reference, the budget's factor.
std::string ArrayOfSharedHeapStrings() {
  const std::string leaf = "\x5F\x10\x10" + std::string(16, 's');
  return SharedLeafList(0xA, ReferencesFor(leaf), leaf);
}
// The most nodes: every byte a reference to `true`.
std::string ArrayOfSharedBooleans() { return SharedLeafList(0xA, ReferencesFor("\x09"), "\x09"); }
// What the budget refuses: each reference to a 32,000-byte string.
std::string ArrayOfSharedLongStrings() {
  const std::string leaf = "\x5F\x11" + BigEndian(32000, 2) + std::string(32000, 's');
  return SharedLeafList(0xA, ReferencesFor(leaf), leaf);
}

std::string Repeated(std::string_view open, std::string_view item, std::string_view close) {
  std::string out(open);
  while (out.size() + item.size() + close.size() <= kInputSize) out += item;
  return out + std::string(close);
}
std::string XmlArrayOfBooleans() {
  return Repeated("<plist><array>", "<true/>", "</array></plist>");
}
std::string TextArrayOfStrings() { return Repeated("(", "a,", "a)"); }

long StatusKb(const char* field) {
  FILE* file = std::fopen("/proc/self/status", "r");
  if (!file) return -1;
  char line[256];
  long kb = -1;
  const size_t length = std::strlen(field);
  while (std::fgets(line, sizeof line, file)) {
    if (std::strncmp(line, field, length) == 0) kb = std::atol(line + length);
  }
  std::fclose(file);
  return kb;
}

// Resets the high-water mark to the current resident size (Linux 4.0 and later).
bool ResetPeak() {
  malloc_trim(0);
  FILE* file = std::fopen("/proc/self/clear_refs", "w");
  if (!file) return false;
  const bool ok = std::fputs("5", file) >= 0;
  return std::fclose(file) == 0 && ok;
}

void BM_Read(benchmark::State& state, std::string (*build)(), bool accepted) {
  const std::string bytes = build();
  long peakKb = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const bool reset = ResetPeak();
    const long baseKb = StatusKb("VmRSS:");
    state.ResumeTiming();
    std::optional<Value> value = ReadPropertyList(bytes);
    state.PauseTiming();
    if (value.has_value() != accepted) state.SkipWithError("read differently than expected");
    if (reset && baseKb >= 0) peakKb = std::max(peakKb, StatusKb("VmHWM:") - baseKb);
    value.reset();
    state.ResumeTiming();
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(bytes.size()));
  state.counters["input_KiB"] = static_cast<double>(bytes.size()) / 1024;
  state.counters["peak_MiB"] = static_cast<double>(peakKb) / 1024;
  state.counters["peak_per_input_byte"] = static_cast<double>(peakKb) * 1024 / bytes.size();
}

BENCHMARK_CAPTURE(BM_Read, binary_shared_strings_array, ArrayOfSharedStrings, true)
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Read, binary_shared_strings_dictionary, DictionaryOfSharedStrings, true)
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Read, binary_shared_heap_strings, ArrayOfSharedHeapStrings, true)
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Read, binary_shared_booleans, ArrayOfSharedBooleans, true)
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Read, binary_shared_long_strings_refused, ArrayOfSharedLongStrings, false)
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Read, xml_booleans, XmlArrayOfBooleans, true)->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Read, text_strings, TextArrayOfStrings, true)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace plist
