// Takes two of our locks in both orders. The thread sanitizer must name the deadlock that could be.
#include <cstdio>
#include <thread>

#include "platform/foundation/lock.h"

int main() {
  yomber::Mutex first;
  yomber::Mutex second;
  std::thread([&] {
    yomber::LockGuard outer(first);
    yomber::LockGuard inner(second);
  }).join();
  std::thread([&] {
    yomber::LockGuard outer(second);
    yomber::LockGuard inner(first);
  }).join();
  std::puts("nothing noticed");
  return 0;
}
