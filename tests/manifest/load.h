#pragma once

#include <atomic>
#include <memory>
#include <stop_token>
#include <thread>
#include <vector>

#include "tests/manifest/load_worker.h"

namespace yomber::testing {

/// Several users at once, started and stopped together.
class Load {
 public:
  Load(const LoadOptions& options, int workers);

  void begin();
  void start();
  /// Nobody begins anything new.
  void requestStop();
  /// Returns when everybody has finished what they were doing.
  void stop();
  /// Waits until so many more things were done; false when nobody gets on.
  bool waitForSteps(std::uint64_t count) const;

  [[nodiscard]] std::vector<std::unique_ptr<LoadWorker>>& workers() { return workers_; }
  [[nodiscard]] const LoadOptions& options() const { return options_; }
  /// What was done, in words.
  [[nodiscard]] std::string summary() const;

 private:
  void run(const std::stop_token& stop, LoadWorker& worker);

  const LoadOptions options_;
  std::vector<std::unique_ptr<LoadWorker>> workers_;
  std::vector<std::jthread> threads_;
  std::atomic<std::uint64_t> steps_{0};
};

}  // namespace yomber::testing
