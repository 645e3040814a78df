#pragma once

#include <memory>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Stands for the host's end of the default NSFileProviderManager while it lives: records the
/// signals and answers each with `setAnswer`'s error.
///
/// Thread-safety: every operation may be called on any thread.
class RecordingManager {
 public:
  RecordingManager();
  ~RecordingManager();
  RecordingManager(const RecordingManager&) = delete;
  RecordingManager& operator=(const RecordingManager&) = delete;

  void setAnswer(NSErrorRef error);
  [[nodiscard]] std::vector<NSFileProviderItemIdentifier> signals() const;
  /// Waits up to ten seconds for so many signals in all.
  [[nodiscard]] bool waitForSignals(std::size_t count) const;

 private:
  class Transport;
  std::shared_ptr<Transport> _transport;
};

}  // namespace yomber
