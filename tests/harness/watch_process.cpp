#include "tests/harness/watch_process.h"

namespace yomber::testing {

WatchProcess::WatchProcess(TestDrive& drive, const std::string& folder)
    : process_(drive.commandLine({"--json", "watch", "--list", folder}), drive.environment()) {}

bool WatchProcess::converges(const std::set<std::string>& expected) {
  return held_ == expected || process_.readUntil([&](const std::string& line) {
    take(line);
    return held_ == expected;
  });
}

bool WatchProcess::shows(const std::string& name) {
  return process_.readUntil([&](const std::string& line) {
    take(line);
    return held_.contains(name);
  });
}

bool WatchProcess::tells(const std::string& event) {
  return process_.readUntil([&](const std::string& line) {
    take(line);
    return lastEvent_ == event;
  });
}

void WatchProcess::take(const std::string& line) {
  const nlohmann::json change = nlohmann::json::parse(line);
  lastEvent_ = change["event"];
  if (lastEvent_ == "removed") {
    const auto known = names_.find(change["id"]);
    if (known == names_.end()) return;
    held_.erase(known->second);
    names_.erase(known);
  } else if (change.contains("item")) {
    const std::string id = change["item"]["id"];
    const auto known = names_.find(id);
    if (known != names_.end()) held_.erase(known->second);
    names_[id] = change["item"]["name"];
    held_.insert(names_[id]);
  }
}

}  // namespace yomber::testing
