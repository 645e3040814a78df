#include <algorithm>
#include <array>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <optional>
#include <random>
#include <set>
#include <sstream>
#include <thread>
#include <utility>

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include "platform/foundation/log_sinks.h"
#include "platform/foundation/stopped_process.h"
#include "tests/harness/watch_process.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Process = TestDrive::Process;

std::set<std::string> namesOnDisk(const std::string& folder) {
  std::set<std::string> names;
  for (const auto& entry : fs::directory_iterator(folder)) names.insert(entry.path().filename());
  return names;
}

/// Whether these lines are those names, each once.
bool lists(const std::string& lines, const std::set<std::string>& names) {
  std::set<std::string> listed;
  std::istringstream stream(lines);
  for (std::string line; std::getline(stream, line);) {
    if (!listed.insert(line).second) return false;
  }
  return listed == names;
}

std::size_t openDescriptors(pid_t process) {
  const fs::directory_iterator all("/proc/" + std::to_string(process) + "/fd");
  return static_cast<std::size_t>(std::distance(all, fs::directory_iterator()));
}

/// How often the extension has dropped a folder's history for its length alone, by its log.
int overflowsInLog(const TestDrive& drive) {
  int overflows = 0;
  bool hasOtherReason = false;
  std::ifstream log(drive.home() + "/log/qs-fileprovider.log");
  for (std::string line; std::getline(log, line);) {
    const auto has = [&](const char* part) { return line.find(part) != std::string::npos; };
    for (const char* reason :
         {"token expired", "error while fetching", "container list did change"})
      hasOtherReason |= has(reason);
    if (has("[DEBUG] invalidating change token") && !std::exchange(hasOtherReason, false))
      ++overflows;
  }
  return overflows;
}

class Recovery : public ::testing::Test {
 protected:
  TestDrive drive_;
};

TEST_F(Recovery, ChangesMadeWhileTheDaemonIsDeadShowWithoutAnyoneAsking) {
  drive_.write("before");
  drive_.up();
  WatchProcess watch(drive_);
  ASSERT_TRUE(watch.shows("before"));
  const auto supervisor = drive_.status()["supervisor"]["pid"].get<pid_t>();
  const pid_t daemon = drive_.pidOf(Process::Zarn);
  {
    const StoppedProcess stopped(supervisor);
    kill(daemon, SIGKILL);
    drive_.write("meanwhile");
    fs::remove(drive_.root() + "/before");
  }
  EXPECT_TRUE(watch.converges({"meanwhile"}));
}

TEST_F(Recovery, AWatchGoesOnWhenTheExtensionIsKilled) {
  drive_.write("before");
  drive_.up();
  WatchProcess watch(drive_);
  ASSERT_TRUE(watch.shows("before"));
  drive_.kill(Process::Extension);
  drive_.write("after");
  EXPECT_TRUE(watch.converges({"before", "after"}));
}

TEST_F(Recovery, AWatchEndsWithAClearErrorWhenTheHostIsKilled) {
  drive_.up();
  LineProcess watch(drive_.commandLine({"--json", "watch", "--list"}), drive_.environment());
  drive_.write("first");
  ASSERT_TRUE(watch.readUntil(
      [](const std::string& line) { return line.find("first") != std::string::npos; }));
  drive_.kill(Process::Host);
  EXPECT_EQ(watch.waitForEnd(), 69);
}

TEST_F(Recovery, AStoppedDaemonIsNoDisconnectAndGoesOnAfterwards) {
  drive_.write("kept");
  drive_.environment()["YOMBER_DAEMON_TIMEOUT_MS"] = "500";
  drive_.up();
  ASSERT_EQ(drive_.names(), (std::vector<std::string>{"kept"}));
  std::optional<StoppedProcess> daemon(drive_.pidOf(Process::Zarn));
  const ProcessResult stuck = drive_.yomber({"ls"});
  EXPECT_FALSE(stuck.timedOut);
  EXPECT_NE(stuck.exitCode, 0);
  EXPECT_FALSE(stuck.errors.empty());
  // Without the host in between.
  const ProcessResult emptying = drive_.yomber({"trash", "--empty"});
  EXPECT_EQ(emptying.exitCode, 69) << emptying.errors;
  daemon.reset();
  EXPECT_TRUE(eventually([&] { return drive_.yomber({"ls"}).output == "kept\n"; }));
}

TEST_F(Recovery, SigningOutInTheMiddleOfAListingEndsItWithAResultOrAClearError) {
  for (int number = 0; number < 20'000; ++number) drive_.write("file " + std::to_string(number));
  drive_.up();
  LineProcess listing(drive_.commandLine({"--json", "ls"}), drive_.environment());
  ASSERT_TRUE(listing.readUntil([](const std::string&) { return true; }));
  ASSERT_EQ(drive_.yomber({"account", "sign-out"}).exitCode, 0);
  std::size_t lines = 1;
  listing.readUntil([&](const std::string&) { return ++lines > 20'000; });
  EXPECT_EQ(listing.waitForEnd(), 77) << lines << " lines";
  EXPECT_LT(lines, 20'000U);
}

TEST_F(Recovery, AFolderSoBusyThatItsHistoryOverflowsAgainAndAgainStillConverges) {
  if (logsToJournal()) GTEST_SKIP() << "this machine logs to its journal";
  drive_.up();
  // Not while anything is listed, which would fill the log.
  const auto logFrom = [&](const char* level) {
    return drive_.yomber({"log", "--level", level}).exitCode == 0;
  };
  WatchProcess watch(drive_);
  int overflows = overflowsInLog(drive_);
  for (int burst = 0; burst < 2; ++burst) {
    // Somebody has to follow the folder, which nobody does while the host lists it anew.
    drive_.write("before burst " + std::to_string(burst));
    ASSERT_TRUE(watch.shows("before burst " + std::to_string(burst)));
    // While the host takes nothing, the extension's history overflows: also when the one request
    // that it may have under way takes what is there, which is less than it takes to overflow.
    std::optional<StoppedProcess> host(drive_.pidOf(Process::Host));
    ASSERT_TRUE(logFrom("debug"));
    for (int number = 0; number < 10'100; ++number) {
      drive_.write("burst " + std::to_string(burst) + " file " + std::to_string(number));
    }
    ASSERT_TRUE(eventually([&] { return overflowsInLog(drive_) > overflows; })) << burst;
    overflows = overflowsInLog(drive_);
    ASSERT_TRUE(logFrom("default"));
    host.reset();
    fs::remove(drive_.root() + "/burst " + std::to_string(burst) + " file 7");
    ASSERT_TRUE(watch.converges(namesOnDisk(drive_.root())));
  }
}

TEST_F(Recovery, AFolderWhoseInodeIsReusedAtOnceSharesNothingWithTheOldOne) {
  drive_.makeFolder("first");
  drive_.write("first/inside");
  drive_.up();
  const std::string before = drive_.json({"id", "first"}).at(0)["id"];
  struct stat old{};
  struct stat now{};
  int reused = 0;
  for (int round = 0; round < 50 && reused == 0; ++round) {
    ASSERT_EQ(stat((drive_.root() + "/first").c_str(), &old), 0);
    fs::remove_all(drive_.root() + "/first");
    drive_.makeFolder("first");
    ASSERT_EQ(stat((drive_.root() + "/first").c_str(), &now), 0);
    reused += old.st_ino == now.st_ino ? 1 : 0;
  }
  if (reused == 0) GTEST_SKIP() << "this file system did not give an inode number twice";
  std::string after;
  EXPECT_TRUE(eventually([&] {
    const ProcessResult found = drive_.yomber({"id", "first"});
    after = found.output;
    return found.exitCode == 0 && after != before + "\n";
  })) << after;
  EXPECT_TRUE(drive_.names("first").empty());
  EXPECT_EQ(drive_.yomber({"stat", before}).exitCode, 66);
}

TEST_F(Recovery, OddNamesAreListedAsTheyAre) {
  const std::string longest(255, 'n');
  const std::vector<std::string> odd{longest,          "bad \xff\xfe utf-8", "two\nlines",
                                     " leading blank", "tab\there",          "'quoted\""};
  for (const std::string& name : odd) drive_.write(name);
  drive_.write("caf\u00e9");   // composed
  drive_.write("cafe\u0301");  // decomposed: the same name to a person
  drive_.up();
  std::set<std::string> shown;
  std::vector<std::string> encoded;
  std::size_t count = 0;
  for (const nlohmann::json& item : drive_.json({"ls"})) {
    ++count;
    if (item.contains("name")) shown.insert(item["name"]);
    if (item.contains("name_base64")) encoded.push_back(item["name_base64"]);
  }
  EXPECT_EQ(count, odd.size() + 2);
  for (const std::string& name : {longest, odd[2], odd[3], odd[4], odd[5]})
    EXPECT_TRUE(shown.contains(name)) << name;
  EXPECT_EQ(encoded, std::vector<std::string>{"YmFkIP/+IHV0Zi04"});
  // One of the twins is shown under another name; both are items of their own.
  EXPECT_FALSE(shown.contains("caf\u00e9") && shown.contains("cafe\u0301"));
}

TEST_F(Recovery, ItemsWithOddNamesAreFoundByNameByLocationAndByIdentifier) {
  struct OddName {
    std::string name;
    std::string key;    ///< of the name in the JSON
    std::string value;  ///< what stands there
  };
  const std::string longest(255, 'n');
  const std::vector<OddName> odd{{longest, "name", longest},
                                 {"two\nlines", "name", "two\nlines"},
                                 {"bad \xff\xfe utf-8", "name_base64", "YmFkIP/+IHV0Zi04"}};
  for (const OddName& each : odd) drive_.write(each.name, each.value);
  drive_.up();
  for (const auto& [name, key, value] : odd) {
    const std::string location = drive_.root() + "/" + name;
    const std::string identifier = drive_.json({"id", name}).at(0)["id"];
    EXPECT_TRUE(identifier.starts_with("d:")) << identifier;
    for (const std::string& item : {name, location, identifier}) {
      EXPECT_EQ(drive_.yomber({"id", item}).output, identifier + "\n") << item;
      EXPECT_EQ(drive_.yomber({"url", item}).output, location + "\n") << item;
      const nlohmann::json shown = drive_.json({"stat", item}).at(0);
      EXPECT_EQ(shown["id"], identifier) << item;
      EXPECT_EQ(shown[key], value) << item;
      EXPECT_EQ(shown["size"], value.size()) << item;
    }
  }
}

TEST_F(Recovery, SigningOutPausesAWatchAndSigningInBringsWhatWasMissed) {
  drive_.write("before");
  drive_.up();
  WatchProcess watch(drive_);
  ASSERT_TRUE(watch.shows("before"));
  ASSERT_EQ(drive_.yomber({"account", "sign-out"}).exitCode, 0);
  ASSERT_TRUE(watch.tells("paused"));
  EXPECT_TRUE(std::ifstream(drive_.root() + "/before").good()) << "local files stay readable";
  drive_.write("meanwhile");
  fs::remove(drive_.root() + "/before");
  drive_.signIn();
  EXPECT_TRUE(watch.converges({"meanwhile"}));
}

TEST_F(Recovery, TheWorkingSetIsFollowedAcrossTheDaemonsEnd) {
  const auto tag = [&](const std::string& name) {
    drive_.write(name);
    ASSERT_EQ(setxattr((drive_.root() + "/" + name).c_str(), "user.xdg.tags", "red", 3, 0), 0);
  };
  tag("first");
  drive_.up();
  LineProcess follow(drive_.commandLine({"--json", "working-set", "--follow"}),
                     drive_.environment());
  const auto tells = [&](const std::set<std::string>& events, const std::string& name) {
    return follow.readUntil([&](const std::string& line) {
      const nlohmann::json change = nlohmann::json::parse(line);
      return events.contains(change["event"]) && (name.empty() || change["item"]["name"] == name);
    });
  };
  ASSERT_TRUE(tells({"present"}, "first"));
  tag("second");
  // The first listing may not be over yet.
  EXPECT_TRUE(tells({"present", "added"}, "second"));
  drive_.kill(Process::Zarn);
  tag("third");
  EXPECT_TRUE(tells({"added"}, "third"));
  ASSERT_EQ(removexattr((drive_.root() + "/first").c_str(), "user.xdg.tags"), 0);
  EXPECT_TRUE(tells({"removed"}, ""));
}

/// Kills at random while clients list and watch.
TEST_F(Recovery, AHundredKillsLeaveNothingHangingAndListsRight) {
  for (int number = 0; number < 300; ++number) drive_.write("file " + std::to_string(number));
  drive_.up();
  const std::set<std::string> expected = namesOnDisk(drive_.root());
  std::atomic<bool> stop = false;
  std::atomic<int> calls = 0;
  std::atomic<int> hung = 0;
  std::atomic<int> wrong = 0;
  std::atomic<int> unclear = 0;
  std::vector<std::jthread> clients;
  for (const char* order : {"name", "date"}) {
    clients.emplace_back([&, order] {
      while (!stop) {
        const ProcessResult listed = drive_.yomber({"ls", "--sort", order});
        hung += listed.timedOut ? 1 : 0;
        wrong += listed.exitCode == 0 && !lists(listed.output, expected) ? 1 : 0;
        unclear += listed.exitCode != 0 && listed.errors.empty() ? 1 : 0;
        ++calls;
      }
    });
  }
  for (int watcher = 0; watcher < 2; ++watcher) {
    clients.emplace_back([&] {
      while (!stop) {
        LineProcess watch(drive_.commandLine({"--json", "watch", "--list"}), drive_.environment());
        const auto enough = std::chrono::steady_clock::now() + std::chrono::seconds(2);
        while (!stop && watch.nextLine(enough)) {
        }
        const bool hasEnded = !stop && std::chrono::steady_clock::now() < enough;
        // Whom a watch asks may be away when it begins, or go later.
        if (hasEnded && watch.waitForEnd() != 69) ++unclear;
      }
    });
  }
  std::mt19937 random(20);  // the same order in every run
  const auto supervisor = drive_.status()["supervisor"]["pid"].get<pid_t>();
  const std::size_t descriptors = openDescriptors(supervisor);
  for (int round = 0; round < 100; ++round) {
    const int before = calls;
    drive_.kill(std::array{Process::Zarn, Process::Host, Process::Extension}[random() % 3]);
    ASSERT_TRUE(eventually([&] { return calls > before; }))
        << "no client call ended after kill " << round;
  }
  stop = true;
  clients.clear();
  EXPECT_EQ(hung, 0);
  EXPECT_EQ(wrong, 0) << "lists that said that they were whole";
  EXPECT_EQ(unclear, 0) << "ends that did not say why";
  EXPECT_EQ(openDescriptors(supervisor), descriptors) << "of who starts them all again";
  EXPECT_TRUE(eventually([&] { return drive_.yomber({"ls"}).exitCode == 0; }));
  EXPECT_TRUE(lists(drive_.yomber({"ls"}).output, expected));
  WatchProcess watch(drive_);
  EXPECT_TRUE(watch.converges(expected));
}

TEST_F(Recovery, TheHostKeepsNothingOfExtensionsThatDied) {
  drive_.write("file");
  drive_.up();
  const auto killAndRecover = [&] {
    drive_.kill(Process::Extension);
    ASSERT_TRUE(eventually([&] { return drive_.yomber({"ls"}).exitCode == 0; }));
  };
  for (int round = 0; round < 3; ++round) killAndRecover();
  const nlohmann::json early = drive_.status()["fileproviderd"];
  for (int round = 0; round < 6; ++round) killAndRecover();
  const nlohmann::json late = drive_.status()["fileproviderd"];
  EXPECT_LE(late["open_descriptors"].get<int>(), early["open_descriptors"].get<int>() + 2);
  EXPECT_LE(late["resident_bytes"].get<long>(), early["resident_bytes"].get<long>() + 8'000'000);
}

TEST_F(Recovery, HostAndExtensionKeepNothingOfDaemonsThatDied) {
  const auto connectionsOfHost = [&] {
    const std::string log = drive_.yomber({"log", "--lines", "100000"}).output;
    int count = 0;
    for (std::size_t at = 0; (at = log.find("connected to zarn", at)) != std::string::npos; ++at)
      ++count;
    return count;
  };
  drive_.write("file");
  drive_.up();
  const auto killAndRecover = [&] {
    const int before = connectionsOfHost();
    drive_.kill(Process::Zarn);
    ASSERT_TRUE(eventually([&] { return drive_.yomber({"ls"}).exitCode == 0; }));
    // The host has its own connection back, too, or would have one more later.
    ASSERT_TRUE(eventually([&] { return connectionsOfHost() > before; }));
  };
  ASSERT_TRUE(eventually([&] { return connectionsOfHost() > 0; }));
  for (int round = 0; round < 3; ++round) killAndRecover();
  const pid_t host = drive_.pidOf(Process::Host);
  const pid_t extension = drive_.pidOf(Process::Extension);
  const std::size_t hostBefore = openDescriptors(host);
  const std::size_t extensionBefore = openDescriptors(extension);
  for (int round = 0; round < 6; ++round) killAndRecover();
  EXPECT_EQ(drive_.pidOf(Process::Host), host);
  EXPECT_EQ(drive_.pidOf(Process::Extension), extension);
  // One more may be on its way.
  EXPECT_TRUE(eventually([&] { return openDescriptors(host) <= hostBefore; }));
  EXPECT_TRUE(eventually([&] { return openDescriptors(extension) <= extensionBefore; }));
}

}  // namespace
}  // namespace yomber::testing
