// Two serial queues change one number. Neither queue orders the other, so the thread sanitizer must
// say so; the queues' own locks must not hide it.
#include <cstdio>

#include "platform/foundation/serial_queue.h"

int main() {
  int number = 0;
  const auto one = yomber::SerialQueue::create("planted one");
  const auto two = yomber::SerialQueue::create("planted two");
  for (int turn = 0; turn < 1000; ++turn) {
    one->async([&number] { ++number; });
    two->async([&number] { ++number; });
  }
  one->sync([] {});
  two->sync([] {});
  std::printf("nothing noticed: %d\n", number);
  return 0;
}
