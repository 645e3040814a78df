#pragma once

#include <cstdio>
#include <cstdlib>

namespace yomber::fuzz {

/// Ends the process with `text` when the condition does not hold, so that the fuzzer keeps the
/// input.
inline void expect(bool holds, const char* text) {
  if (holds) return;
  (void)std::fprintf(stderr, "NOT TRUE: %s\n", text);
  std::abort();
}

}  // namespace yomber::fuzz
