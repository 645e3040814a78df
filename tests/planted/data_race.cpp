// Two serial queues change one number. Neither queue orders the other, so the thread sanitizer must
// say so; the queues' own locks must not hide it.
#include <atomic>
#include <cstdint>
#include <cstdio>
#include <latch>
#include <thread>

#include "platform/foundation/serial_queue.h"

int main() {
  // Fills a word, of whose accesses the sanitizer recalls but a few.
  volatile std::int64_t number = 0;
  std::latch both(2);  // orders what comes before it, and nothing after
  // The second change comes after the first, and a relaxed flag orders nothing else: of two
  // accesses in the very same instant the sanitizer may see neither, however often they are
  // repeated.
  std::atomic<bool> changed = false;
  const auto one = yomber::SerialQueue::create("planted one");
  const auto two = yomber::SerialQueue::create("planted two");
  one->async([&] {
    both.arrive_and_wait();
    number = number + 1;
    changed.store(true, std::memory_order_relaxed);
  });
  two->async([&] {
    both.arrive_and_wait();
    while (!changed.load(std::memory_order_relaxed)) std::this_thread::yield();
    number = number + 1;
  });
  one->sync([] {});
  two->sync([] {});
  std::puts("nothing noticed");
  return 0;
}
