#include "zarn/random_id.h"

#include <sys/random.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdlib>

#include "zarn/item_row.h"

namespace yomber {
namespace {

/// Random numbers by the kilobyte, so that a scan does not pay a system call for each.
class RandomPool {
 public:
  std::uint64_t next() {
    if (used_ == numbers_.size()) refill();
    return numbers_[used_++];
  }

 private:
  void refill() {
    auto* const bytes = reinterpret_cast<char*>(numbers_.data());
    std::size_t filled = 0;
    while (filled < sizeof(numbers_)) {
      const ssize_t count = getrandom(bytes + filled, sizeof(numbers_) - filled, 0);
      if (count < 0 && errno != EINTR) std::abort();  // the kernel has no randomness at all
      if (count > 0) filled += static_cast<std::size_t>(count);
    }
    used_ = 0;
  }

  std::array<std::uint64_t, 128> numbers_{};
  std::size_t used_ = numbers_.size();
};

}  // namespace

std::uint64_t randomID() {
  thread_local RandomPool pool;
  for (;;) {
    const std::uint64_t id = pool.next() >> 1U;
    if (id >= kFirstIssuedID) return id;
  }
}

}  // namespace yomber
