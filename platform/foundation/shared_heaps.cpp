#include "platform/foundation/shared_heaps.h"

#include <malloc.h>

namespace yomber {

void shareHeaps() {
  constexpr int kHeaps = 2;
  (void)mallopt(M_ARENA_MAX, kHeaps);
}

}  // namespace yomber
