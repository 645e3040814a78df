// Writes one byte past a heap block. The address sanitizer must say so.
#include <cstdio>
#include <memory>

int main(int argc, char** argv) {
  (void)argv;
  const auto bytes = std::make_unique<char[]>(8);
  const auto beyond = 7U + static_cast<unsigned>(argc);
  bytes.get()[beyond] = 'x';
  std::printf("nothing noticed: %d\n", bytes.get()[beyond]);
  return 0;
}
