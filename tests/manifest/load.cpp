#include "tests/manifest/load.h"

#include "tests/harness/child_process.h"

namespace yomber::testing {

Load::Load(const LoadOptions& options, int workers) : options_(options) {
  for (int number = 0; number < workers; ++number) {
    workers_.push_back(std::make_unique<LoadWorker>(options, number));
  }
}

void Load::begin() {
  for (const auto& worker : workers_) worker->begin();
}

void Load::start() {
  for (const auto& worker : workers_) {
    worker->forgetConnections();
    threads_.emplace_back(
        [this, &worker = *worker](const std::stop_token& stop) { run(stop, worker); });
  }
}

void Load::requestStop() {
  for (std::jthread& thread : threads_) thread.request_stop();
}

void Load::stop() {
  requestStop();
  threads_.clear();
}

bool Load::waitForSteps(std::uint64_t count) const {
  const std::uint64_t wanted = steps_ + count;
  return eventually([&] { return steps_ >= wanted; });
}

void Load::run(const std::stop_token& stop, LoadWorker& worker) {
  while (!stop.stop_requested()) {
    // Who got nothing done waits for the drive, or for others, before the next try.
    const bool isDone = eventually([&] { return stop.stop_requested() || worker.step(); });
    if (isDone) ++steps_;
  }
}

std::string Load::summary() const {
  std::map<std::string, int> all;
  for (const auto& worker : workers_) {
    for (const auto& [what, count] : worker->done()) all[what] += count;
  }
  std::string text;
  for (const auto& [what, count] : all) {
    text += (text.empty() ? "" : ", ") + what + " " + std::to_string(count);
  }
  return text;
}

}  // namespace yomber::testing
