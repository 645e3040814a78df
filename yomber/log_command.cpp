#include <algorithm>
#include <array>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <tuple>
#include <vector>

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/foundation/log_level.h"
#include "platform/foundation/log_sinks.h"
#include "yomber/command.h"

namespace yomber {

namespace {

namespace fs = std::filesystem;

struct LogOptions {
  bool follow = false;
  std::string level;
  std::size_t lines = 200;
};

/// The drive's log files, read on from where the last reading of each ended.
class LogFiles {
 public:
  explicit LogFiles(std::string directory) : directory_(std::move(directory)) {}

  /// Every whole line that came since the last call, of all programs, by time.
  std::vector<std::string> newLines() {
    std::vector<std::string> lines;
    std::error_code failure;
    for (const auto& entry : fs::directory_iterator(directory_, failure)) {
      if (entry.path().extension() == ".log") readNew(entry.path(), lines);
    }
    // Every line starts with its time, in a form that sorts as text.
    std::ranges::stable_sort(lines);
    return lines;
  }

 private:
  /// Its inode and birth: a full file goes on under another name.
  using File = std::tuple<std::uint64_t, std::int64_t, std::uint32_t>;

  void readNew(const fs::path& path, std::vector<std::string>& lines) {
    struct statx now{};
    if (statx(AT_FDCWD, path.c_str(), 0, STATX_INO | STATX_SIZE | STATX_BTIME, &now) != 0) return;
    std::streamoff& end = ends_[File(now.stx_ino, now.stx_btime.tv_sec, now.stx_btime.tv_nsec)];
    // Where births are not known: another file that has got the number of one that went.
    if (static_cast<std::uint64_t>(end) > now.stx_size) end = 0;
    std::ifstream file(path);
    file.seekg(end);
    for (std::string line; std::getline(file, line) && !file.eof();) {
      end += static_cast<std::streamoff>(line.size()) + 1;
      lines.push_back(std::move(line));
    }
  }

  const std::string directory_;
  std::map<File, std::streamoff> ends_;
};

void print(const std::vector<std::string>& lines, std::size_t last) {
  const std::size_t from = lines.size() > last ? lines.size() - last : 0;
  for (std::size_t index = from; index < lines.size(); ++index) std::cout << lines[index] << "\n";
  std::cout << std::flush;
}

/// Blocks until something was written in the directory.
bool waitForChange(int notifier) {
  alignas(inotify_event) std::array<char, 4096> events{};
  return read(notifier, events.data(), events.size()) > 0;
}

void showFiles(CommandContext& context, const DrivePaths& paths, const LogOptions& options) {
  const int notifier = inotify_init1(IN_CLOEXEC);
  if (options.follow &&
      inotify_add_watch(notifier, paths.log.c_str(), IN_MODIFY | IN_CREATE | IN_MOVED_TO) < 0) {
    close(notifier);
    return context.fail(NSError::errorWithErrno(errno, paths.log));
  }
  LogFiles files(paths.log);
  print(files.newLines(), options.lines);
  while (options.follow && std::cout && waitForChange(notifier))
    print(files.newLines(), static_cast<std::size_t>(-1));
  close(notifier);
}

/// The journal has its own reader; it becomes this process.
void showJournal(CommandContext& context, const DrivePaths& paths, const LogOptions& options) {
  std::vector<std::string> words{"journalctl", "--no-pager", "--output=short-iso-precise",
                                 "--lines=" + std::to_string(options.lines)};
  for (const char* program : {"zarn", "fileproviderd", "qs-fileprovider", "supervisor",
                              "yomber-mount", "mount-supervisor"}) {
    words.push_back("--identifier=" + journalIdentifier(program, paths));
  }
  if (options.follow) words.emplace_back("--follow");
  std::vector<char*> arguments;
  for (std::string& word : words) arguments.push_back(word.data());
  arguments.push_back(nullptr);
  execvp(arguments[0], arguments.data());
  context.fail(NSError::errorWithErrno(errno, "journalctl"));
}

void runLog(CommandContext& context, const LogOptions& options) {
  const DrivePaths paths = context.paths();
  if (!options.level.empty()) {
    const std::optional<LogLevel> level = logLevelNamed(options.level);
    if (NSErrorRef error = setSharedLogLevel(paths, *level)) return context.fail(error);
    if (!options.follow) {
      std::cout << "Every process of the drive now logs from level " << options.level << " on."
                << std::endl;
      return;
    }
  }
  if (logsToJournal()) return showJournal(context, paths, options);
  showFiles(context, paths, options);
}

}  // namespace

void addLogCommand(CLI::App& app, CommandContext& context) {
  CLI::App* log =
      app.add_subcommand("log", "Show what the drive's processes log, or set how much they do");
  auto options = std::make_shared<LogOptions>();
  log->add_flag("-f,--follow", options->follow, "Go on printing what comes");
  log->add_option("--level", options->level, "From now on, log this level and all above it")
      ->check(CLI::IsMember({"debug", "info", "default", "error", "fault"}));
  log->add_option("--lines", options->lines, "How many of the last lines to print")
      ->capture_default_str();
  log->callback([&context, options] { runLog(context, *options); });
}

}  // namespace yomber
