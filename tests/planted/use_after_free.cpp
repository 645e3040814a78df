// Reads a block through a serial queue after it was freed. The address sanitizer must say so, on a
// thread of ours.
#include <cstdio>

#include "platform/foundation/serial_queue.h"

int main() {
  const auto queue = yomber::SerialQueue::create("planted");
  int* number = new int(7);
  delete number;
  queue->async([number] { std::printf("nothing noticed: %d\n", *number); });
  queue->sync([] {});
  return 0;
}
