// Adds to the largest int. The undefined-behaviour sanitizer must say so.
#include <cstdio>
#include <limits>

int main(int argc, char** argv) {
  (void)argv;
  const int sum = std::numeric_limits<int>::max() - 1 + 2 * argc;
  std::printf("nothing noticed: %d\n", sum);
  return 0;
}
