// Two serial queues change one number at the same time. Neither queue orders the other, so the
// thread sanitizer must say so; the queues' own locks must not hide it.
#include <cstdio>
#include <latch>

#include "platform/foundation/serial_queue.h"

int main() {
  volatile int number = 0;
  std::latch both(2);  // orders what comes before it, and nothing after
  const auto change = [&] {
    both.arrive_and_wait();
    // Of two accesses in the very same instant the sanitizer may see neither.
    for (int turn = 0; turn < 1000; ++turn) number = number + 1;
  };
  const auto one = yomber::SerialQueue::create("planted one");
  const auto two = yomber::SerialQueue::create("planted two");
  one->async(change);
  two->async(change);
  one->sync([] {});
  two->sync([] {});
  std::printf("nothing noticed: %d\n", number);
  return 0;
}
