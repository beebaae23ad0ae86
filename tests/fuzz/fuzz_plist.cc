// Fuzzes the property-list decoder's bounds: the input is decoded in both
// format-detecting and binary-only modes, and whatever decodes must stay
// within the byte budget of its input and the nesting bound. Binary lists
// share objects by reference, so the budget is what keeps a small input
// from expanding into a huge tree; the depth bound keeps both formats off
// the end of the stack.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <optional>

#include "base/VSABinaryPlist.h"
#include "base/VSAPlist.h"

namespace {
int depthOf(const VSAValue& v) {
  int deepest = 0;
  if (auto a = v.arrayValue())
    for (const VSAValue& c : *a) deepest = std::max(deepest, 1 + depthOf(c));
  if (auto d = v.dictionaryValue())
    for (const auto& [k, c] : *d) deepest = std::max(deepest, 1 + depthOf(c));
  return deepest;
}

void check(const std::optional<VSAValue>& v, size_t size) {
  if (!v) return;
  if (VSABinaryPlist::decodedSize(*v) > VSABinaryPlist::decodedSizeBudget(size)) __builtin_trap();
  if (depthOf(*v) > VSABinaryPlist::kMaxDepth) __builtin_trap();
}
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  auto any = VSAPlist::parse(data, size, nullptr);
  check(any, size);
  auto binary = VSAPlist::parse(data, size, nullptr, VSAPlist::Accept::BinaryOnly);
  check(binary, size);
  // Binary-only accepts exactly the binary lists the detecting parse accepts.
  if (binary.has_value() != (any.has_value() && VSABinaryPlist::isBinaryPlist(data, size)))
    __builtin_trap();
  return 0;
}
