#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>
#include <string>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/scripted_daemon.h"
#include "provider/testing/collected_log.h"
#include "provider/testing/recording_manager.h"
#include "provider/testing/recording_observers.h"

namespace yomber {

/// The extension's surroundings: a daemon that answers what the test says, the host's end of the
/// signals, and the log.
struct ProviderSurroundings {
  /// The path of something in the drive's root.
  [[nodiscard]] std::string inRoot(const std::string& name) const {
    return daemon.root() + "/" + name;
  }
  /// From now on the daemon answers for this account. The library is not told.
  void setAccount(const ScriptedDaemon::Account& account) {
    daemon.script([&account](ScriptedDaemon::Answers& answers) {
      answers.account = [account] { return account; };
    });
  }

  CollectedLog log;
  ScriptedDaemon daemon;
  RecordingManager manager;
};

class ProviderTest : public ::testing::Test, protected ProviderSurroundings {};

template <typename Body>
[[noreturn]] void runAndExit(const Body& body) {
  body();
  std::_Exit(::testing::Test::HasFailure() ? EXIT_FAILURE : EXIT_SUCCESS);
}

/// Runs the body, a block of expectations, in a process of its own: for what is kept for the life
/// of a process.
#define EXPECT_IN_FRESH_PROCESS(...)                                            \
  do {                                                                          \
    GTEST_FLAG_SET(death_test_style, "threadsafe");                             \
    const auto body = [&] __VA_ARGS__;                                          \
    EXPECT_EXIT(runAndExit(body), ::testing::ExitedWithCode(EXIT_SUCCESS), ""); \
  } while (false)

/// What the error is, for comparisons: "domain code".
inline std::string domainAndCode(const NSErrorRef& error) {
  return error == nullptr ? "nil" : error->domain() + " " + std::to_string(error->code());
}

}  // namespace yomber
