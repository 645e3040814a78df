#pragma once

#include <map>
#include <set>
#include <string>

#include "tests/harness/test_drive.h"

namespace yomber::testing {

/// A `yomber watch --list` of one folder, and what it holds, kept up to date from its lines.
class WatchProcess {
 public:
  explicit WatchProcess(TestDrive& drive, const std::string& folder = "/");

  /// Reads until what the watch holds is what is given.
  bool converges(const std::set<std::string>& expected);
  /// Reads until the watch holds the name.
  bool shows(const std::string& name);
  /// Reads until the watch tells an event of that kind.
  bool tells(const std::string& event);

 private:
  void take(const std::string& line);

  LineProcess process_;
  std::map<std::string, std::string> names_;  ///< by identifier
  std::set<std::string> held_;
  std::string lastEvent_;
};

}  // namespace yomber::testing
