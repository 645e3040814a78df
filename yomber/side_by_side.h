#pragma once

#include <algorithm>
#include <atomic>
#include <cstddef>
#include <thread>
#include <vector>

namespace yomber {

/// Runs `work(index)` for each index below `count`, at most `width` of them at a time, and waits
/// for all. Commands on many items spend their time waiting for disks and other processes.
template <typename Work>
void sideBySide(std::size_t count, std::size_t width, const Work& work) {
  std::atomic<std::size_t> next{0};
  const auto run = [&] {
    for (std::size_t index = next++; index < count; index = next++) work(index);
  };
  std::vector<std::jthread> others;
  for (std::size_t i = 1; i < std::min(count, width); ++i) others.emplace_back(run);
  run();
}

}  // namespace yomber
