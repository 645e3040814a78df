#include "platform/foundation/uuid.h"

#include <sys/random.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <span>

#include "platform/foundation/hexadecimal.h"

namespace yomber {

void uuid_generate(UUID& out) {
  // Reads of up to 256 bytes are never cut short; only a signal before the pool is ready
  // interrupts.
  while (getrandom(out.data(), out.size(), 0) != static_cast<ssize_t>(out.size())) {
    if (errno == EINTR) continue;
    std::fprintf(stderr, "uuid_generate: the system has no random numbers: %s\n",
                 std::strerror(errno));
    std::abort();
  }
  out[6] = static_cast<std::uint8_t>((out[6] & 0x0fU) | 0x40U);  // version 4: random
  out[8] = static_cast<std::uint8_t>((out[8] & 0x3fU) | 0x80U);  // variant of RFC 4122
}

void uuid_copy(UUID& out, const UUID& in) { out = in; }

int uuid_compare(const UUID& left, const UUID& right) {
  const int order = std::memcmp(left.data(), right.data(), left.size());
  return order < 0 ? -1 : (order > 0 ? 1 : 0);
}

std::string uuid_unparse(const UUID& uuid) {
  std::string out = hexadecimal(std::as_bytes(std::span(uuid)));
  for (const std::size_t place : {8U, 13U, 18U, 23U}) out.insert(place, 1, '-');
  return out;
}

}  // namespace yomber
