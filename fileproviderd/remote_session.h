#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "fileproviderd/extension_session.h"

namespace yomber {

/// Starts the extension program as a process of its own, with a connection to it.
class ProcessLauncher final : public ExtensionLauncher {
 public:
  struct Options {
    std::string program;  ///< the executable
    std::string home;     ///< of the drive
    /// How long a request may take: the extension asks zarn, which may be busy.
    std::chrono::milliseconds callLimit{30'000};
  };
  explicit ProcessLauncher(Options options) : options_(std::move(options)) {}
  ExtensionSessionRef launch(ExtensionEvents events, NSErrorRef* error) override;

 private:
  const Options options_;
};

}  // namespace yomber
