#include "tests/harness/test_drive.h"

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include <poll.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h>  // Debian 12's does not say extern "C" itself
}

#include <gtest/gtest.h>

#include "platform/foundation/stopped_process.h"
#include "platform/ostrell/constants.h"

namespace yomber::testing {

namespace fs = std::filesystem;

std::string programPath(const std::string& name) {
  if (const char* build = std::getenv("YOMBER_BUILD_DIR"))
    return std::string(build) + "/bin/" + name;
  return (fs::read_symlink("/proc/self/exe").parent_path() / name).string();
}

namespace {

/// Ends the test at once: nothing that it says afterwards would mean anything.
void require(bool holds, const std::string& what) {
  if (!holds) throw std::runtime_error("the drive for this test cannot be had: " + what);
}

std::vector<pid_t> childrenOf(pid_t parent) {
  std::vector<pid_t> result;
  std::error_code failure;
  for (const auto& task :
       fs::directory_iterator("/proc/" + std::to_string(parent) + "/task", failure)) {
    std::ifstream children(task.path() / "children");
    for (pid_t child = 0; children >> child;) result.push_back(child);
  }
  return result;
}

/// The pid of the child of `parent` whose program has that name.
std::optional<pid_t> childNamed(pid_t parent, const std::string& program) {
  for (const pid_t child : childrenOf(parent)) {
    std::error_code failure;
    const fs::path executable =
        fs::read_symlink("/proc/" + std::to_string(child) + "/exe", failure);
    if (!failure && executable.filename() == program) return child;
  }
  return std::nullopt;
}

}  // namespace

TestDrive::TestDrive() : TestDrive(fs::temp_directory_path().string()) {}

TestDrive::TestDrive(const std::string& parent) {
  std::string pattern = (fs::path(parent) / "yomber.XXXXXX").string();
  require(mkdtemp(pattern.data()) != nullptr, pattern);
  directory_ = pattern;
  home_ = directory_ + "/home";
  root_ = home_ + "/tree/" + QSUbiquitousDefaultContainerID + "/Documents";
  for (const std::string& place :
       {home_, home_ + "/tree", home_ + "/tree/" + QSUbiquitousDefaultContainerID, root_}) {
    fs::create_directory(place);
    fs::permissions(place, fs::perms::owner_all);
  }
  fs::create_directories(directory_ + "/data/applications");
  // Nothing of the machine's own: sockets, applications and settings are the test's. And
  // uploads begin at once.
  environment_ = {{"YOMBER_HOME", home_},
                  {"XDG_RUNTIME_DIR", ""},
                  {"XDG_DATA_HOME", directory_ + "/data"},
                  {"XDG_DATA_DIRS", directory_ + "/data"},
                  {"HOME", directory_},
                  {"YOMBER_UPLOAD_PAUSE_MS", "0"}};
}

TestDrive::~TestDrive() {
  if (up_) down();
  if (::testing::Test::HasFailure()) {
    const ProcessResult log = yomber({"log", "--lines", "60"});
    std::cerr << "--- the drive's log\n" << log.output << log.errors;
  }
  std::error_code failure;
  fs::remove_all(directory_, failure);
}

void TestDrive::up(const std::vector<std::string>& command) {
  up_ = true;
  std::vector<std::string> words = command;
  for (std::string& word : commandLine({"up"})) words.push_back(std::move(word));
  if (!store_.empty()) words.insert(words.end(), {"--store", store_});
  const ProcessResult started = runProcess(words, environment_);
  require(started.exitCode == 0, started.errors);
  supervisor_ = status()["supervisor"]["pid"];
  signIn();
}

void TestDrive::signIn() {
  const ProcessResult signedIn = yomber({"account", "sign-in", account_});
  require(signedIn.exitCode == 0, signedIn.errors);
}

void TestDrive::down() {
  up_ = false;
  const ProcessResult ended = yomber({"down"});
  EXPECT_EQ(ended.exitCode, 0) << ended.errors;
}

void TestDrive::crash() {
  up_ = false;
  // Nothing is started again meanwhile, and nothing is missed.
  const StoppedProcess stopped(supervisor_);
  std::vector<pid_t> processes{supervisor_};
  for (std::size_t i = 0; i < processes.size(); ++i) {
    for (const pid_t child : childrenOf(processes[i])) processes.push_back(child);
  }
  std::vector<pollfd> ends;
  for (const pid_t process : processes) {
    ends.push_back({.fd = pidfd_open(process, 0), .events = POLLIN, .revents = 0});
    ::kill(process, SIGKILL);
  }
  const int limit = static_cast<int>(std::chrono::milliseconds(patience).count());
  for (pollfd& end : ends) {
    require(end.fd < 0 || poll(&end, 1, limit) == 1, "a process cannot be killed");
    if (end.fd >= 0) close(end.fd);
  }
}

std::vector<std::string> TestDrive::commandLine(const std::vector<std::string>& arguments) const {
  std::vector<std::string> words{programPath("yomber")};
  words.insert(words.end(), arguments.begin(), arguments.end());
  return words;
}

ProcessResult TestDrive::yomber(const std::vector<std::string>& arguments,
                                std::chrono::milliseconds limit) const {
  return runProcess(commandLine(arguments), environment_, limit);
}

std::vector<nlohmann::json> TestDrive::json(const std::vector<std::string>& arguments) const {
  std::vector<std::string> words{"--json"};
  words.insert(words.end(), arguments.begin(), arguments.end());
  const ProcessResult result = yomber(words);
  EXPECT_EQ(result.exitCode, 0) << result.errors;
  std::vector<nlohmann::json> lines;
  std::istringstream output(result.output);
  for (std::string line; std::getline(output, line);) lines.push_back(nlohmann::json::parse(line));
  return lines;
}

std::vector<std::string> TestDrive::names(const std::string& folder,
                                          const std::string& sort) const {
  std::vector<std::string> names;
  for (const nlohmann::json& item : json({"ls", folder, "--sort", sort}))
    names.push_back(item.at("name"));
  return names;
}

nlohmann::json TestDrive::status() const {
  const ProcessResult result = yomber({"--json", "status"});
  return nlohmann::json::parse(result.output, nullptr, false);
}

pid_t TestDrive::pidOf(Process process) const {
  std::optional<pid_t> found;
  eventually([&] {
    const nlohmann::json now = status();
    if (!now.is_object() || !now.contains("supervisor")) return false;
    const pid_t supervisor = now["supervisor"]["pid"];
    if (process == Process::Zarn) {
      found = childNamed(supervisor, "zarn");
    } else {
      const auto host = childNamed(supervisor, "fileproviderd");
      found = process == Process::Host || !host ? host : childNamed(*host, "qs-fileprovider");
    }
    return found.has_value();
  });
  // No number stands for "none" here: a test may kill what it gets.
  require(found.has_value(), "the process is not there");
  return *found;
}

void TestDrive::kill(Process process) const {
  const pid_t pid = pidOf(process);
  if (pid > 0) ::kill(pid, SIGKILL);
}

void TestDrive::write(const std::string& relativePath, const std::string& content) const {
  std::ofstream file(root_ + "/" + relativePath, std::ios::binary | std::ios::trunc);
  file << content;
  require(file.good(), "cannot write " + relativePath);
}

void TestDrive::makeFolder(const std::string& relativePath) const {
  fs::create_directories(root_ + "/" + relativePath);
}

}  // namespace yomber::testing
