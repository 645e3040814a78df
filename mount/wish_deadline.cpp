#include "mount/wish_deadline.h"

namespace yomber {

void WishDeadline::look(const Downloads& before, const Downloads& after, TimePoint now) {
  bool hasMoved = before != after;
  const auto own = after.running.find(path_);
  if (own != after.running.end()) {
    const Downloads::Bytes& bytes = own->second;
    const auto earlier = before.running.find(path_);
    const bool isBeingCopied = bytes.done > 0 && bytes.done < bytes.total;
    if (isBeingCopied) hasMoved = earlier == before.running.end() || earlier->second != bytes;
  }
  if (hasMoved) when_ = now + limit_;
}

}  // namespace yomber
