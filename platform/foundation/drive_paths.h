#pragma once

#include <string>
#include <string_view>

#include "platform/foundation/error.h"

namespace yomber {

/// The places of a drive, all computed from its home.
///
/// Value type. Every process of a drive computes the same places, as long as they see the same
/// environment and the drive was not given another store meanwhile.
struct DrivePaths {
  std::string home;              ///< absolute, symbolic links resolved
  std::string homeHash;          ///< 16 hexadecimal digits that name the drive on this machine
  std::string tree;              ///< the synced tree
  std::string privateDirectory;  ///< staging, on the tree's file system
  std::string database;          ///< the daemon's database file
  std::string store;             ///< the embedded record store; elsewhere after `joinStore`
  std::string log;               ///< log files, where there is no journal
  std::string runtimeDirectory;  ///< sockets and the log level, gone with the session
  std::string daemonSocket;      ///< where zarn listens
  std::string controlSocket;     ///< where the host listens
  std::string logLevelPage;      ///< see log_level.h

  /// The places of the drive at `home`, which need not exist; a relative one counts from the
  /// working directory.
  static DrivePaths forHome(std::string_view home);
  /// $YOMBER_HOME, else $XDG_DATA_HOME/yomber, else ~/.local/share/yomber.
  static DrivePaths forDefaultHome();

  /// Makes the directories that are missing, with mode 0700, and checks that each one is a
  /// directory of this user's that nobody else may enter. Answers nil or the first failure, with a
  /// description that says what to do.
  [[nodiscard]] NSErrorRef create() const;
  /// The same without making anything.
  [[nodiscard]] NSErrorRef check() const;

  /// Makes `directory`, which is made where it is missing, the drive's record store from now on;
  /// drives that share things have one together. For a drive that is not up. Refused with
  /// NSPOSIXErrorDomain EEXIST for a drive that has another store already.
  [[nodiscard]] NSErrorRef joinStore(std::string_view directory);
};

}  // namespace yomber
