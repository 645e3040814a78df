#pragma once

#include <array>

#include <linux/capability.h>

namespace yomber {

/// Takes from the calling thread, for a scope, the right to leave set-id bits on files that it
/// writes to. Files that the kernel is then given to write to by itself lose those bits with the
/// first write, as they should: it writes with the rights of whoever gave them to it.
class WithoutSetIDCapability {
 public:
  WithoutSetIDCapability();
  ~WithoutSetIDCapability();
  WithoutSetIDCapability(const WithoutSetIDCapability&) = delete;
  WithoutSetIDCapability& operator=(const WithoutSetIDCapability&) = delete;

 private:
  using Rights = std::array<__user_cap_data_struct, _LINUX_CAPABILITY_U32S_3>;
  Rights before_{};
  bool isTaken_ = false;
};

}  // namespace yomber
