#include "platform/drawing/program_drawer.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <filesystem>
#include <initializer_list>
#include <string_view>
#include <system_error>
#include <utility>

#include "platform/drawing/spawned_process.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

constexpr const char* kLimiter = "/usr/bin/prlimit";
constexpr const char* kResult = "/output/picture.png";

constexpr std::string_view kResultPrefix = "yomber-drawing.";

bool takeLock(int file) { return flock(file, LOCK_EX | LOCK_NB) == 0; }

/// An empty file for one result, removed at the end. It has a name, since what confines programs
/// brings in only what has one; its lock says that it is in use.
class ResultFile {
 public:
  ResultFile() {
    constexpr int kAttempts = 8;
    for (int attempt = 0; attempt < kAttempts && path_.empty(); ++attempt) {
      std::string pattern = fs::temp_directory_path() / (std::string(kResultPrefix) + "XXXXXX");
      file_ = FileDescriptor(mkostemp(pattern.data(), O_CLOEXEC));
      if (!file_) return;
      // Before it was locked, another process may have taken it for one that was left behind.
      struct stat status{};
      const bool isOurs =
          takeLock(file_.get()) && fstat(file_.get(), &status) == 0 && status.st_nlink > 0;
      if (isOurs) path_ = pattern;
    }
  }
  ~ResultFile() {
    if (!path_.empty()) (void)unlink(path_.c_str());
  }
  ResultFile(const ResultFile&) = delete;
  ResultFile& operator=(const ResultFile&) = delete;

  [[nodiscard]] const std::string& path() const { return path_; }
  /// What is in it now, in memory: whoever wrote it may do so still. Nothing when it is empty, or
  /// too large.
  [[nodiscard]] FileDescriptor copy(std::uint64_t limit) const {
    FileDescriptor copied(memfd_create("yomber-drawing", MFD_CLOEXEC));
    std::uint64_t size = 0;
    off_t at = 0;
    while (copied && size <= limit) {
      const ssize_t count = sendfile(copied.get(), file_.get(), &at, limit + 1 - size);
      if (count < 0) return {};
      if (count == 0) break;
      size += static_cast<std::uint64_t>(count);
    }
    return size > 0 && size <= limit ? std::move(copied) : FileDescriptor();
  }

 private:
  std::string path_;
  FileDescriptor file_;
};

/// Removes the results that killed processes have left.
void removeStaleResults() {
  std::error_code failure;
  fs::directory_iterator entry(fs::temp_directory_path(failure), failure);
  for (; !failure && entry != fs::directory_iterator(); entry.increment(failure)) {
    const std::string path = entry->path();
    if (!entry->path().filename().string().starts_with(kResultPrefix)) continue;
    const FileDescriptor file(open(path.c_str(), O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat status{};
    const bool isResult = file && fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode) &&
                          status.st_uid == geteuid();
    if (isResult && takeLock(file.get())) (void)unlink(path.c_str());
  }
}

/// With its dot; empty for what a program should not be given.
std::string plainExtension(const std::string& name) {
  const std::string extension = fs::path(name).extension();
  const bool isPlain = extension.size() > 1 && extension.size() <= 9 &&
                       std::all_of(extension.begin() + 1, extension.end(), [](unsigned char c) {
                         return c < 0x80 && std::isalnum(c) != 0;
                       });
  return isPlain ? extension : std::string();
}

std::string filled(std::string_view argument, const std::string& input, std::uint32_t side) {
  std::string result;
  for (std::size_t at = 0; at < argument.size(); ++at) {
    const char next = argument[at] == '%' && at + 1 < argument.size() ? argument[++at] : '\0';
    switch (next) {
      case '\0':
        result += argument[at];
        break;
      case 'i':
        result += input;
        break;
      case 'u':
        result += "file://" + input;
        break;
      case 'o':
        result += kResult;
        break;
      case 's':
        result += std::to_string(side);
        break;
      default:
        result += next;
    }
  }
  return result;
}

NSErrorRef nothingDrawn() {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileReadCorruptFileError,
      {{NSLocalizedDescriptionKey, "its thumbnailer draws nothing of it, or it is damaged"}});
}

/// One that the user has put elsewhere is brought in by itself.
void bindProgram(const std::string& program, std::vector<std::string>& words) {
  if (program.starts_with('/') && !program.starts_with("/usr/"))
    words.insert(words.end(), {"--ro-bind-try", program, program});
}

}  // namespace

bool ProgramDrawer::isAvailable() const {
  return access(options_.confiner.c_str(), X_OK) == 0 && access(kLimiter, X_OK) == 0;
}

std::vector<std::string> ProgramDrawer::confinement() const {
  const std::string room = std::to_string(options_.fileSize);
  std::vector<std::string> words{kLimiter,
                                 "--as=" + std::to_string(options_.memory),
                                 "--cpu=" + std::to_string(options_.processorSeconds),
                                 "--fsize=" + room,
                                 "--core=0",
                                 "--",
                                 options_.confiner};
  const auto add = [&words](std::initializer_list<std::string> more) {
    words.insert(words.end(), more);
  };
  add({"--unshare-user", "--unshare-ipc", "--unshare-pid", "--unshare-net", "--unshare-uts"});
  add({"--unshare-cgroup-try", "--disable-userns", "--cap-drop", "ALL", "--die-with-parent"});
  add({"--new-session", "--clearenv", "--setenv", "PATH", "/usr/local/bin:/usr/bin:/bin"});
  add({"--setenv", "LANG", "C.UTF-8", "--setenv", "HOME", "/tmp", "--chdir", "/"});
  add({"--ro-bind", "/usr", "/usr"});
  for (const char* const part :
       {"/bin", "/lib", "/lib64", "/etc/ld.so.cache", "/etc/alternatives", "/etc/fonts"})
    add({"--ro-bind-try", part, part});
  add({"--proc", "/proc", "--dev", "/dev", "--size", room, "--tmpfs", "/dev/shm"});
  add({"--size", room, "--tmpfs", "/tmp"});
  return words;
}

NSErrorRef ProgramDrawer::run(const std::vector<std::string>& words) const {
  SpawnedProcess process;
  if (const int number = process.start(words, {}); number != 0)
    return NSError::errorWithErrno(number, words.front());
  if (!process.waitFor(options_.patience)) return NSError::errorWithErrno(ETIME);
  // The confiner says so of a program that was killed.
  constexpr int kKilled = 128;
  if (process.exitCode().value_or(kKilled + 1) > kKilled) return NSError::errorWithErrno(EIO);
  return *process.exitCode() == 0 ? nullptr : nothingDrawn();
}

/// Whether the program is there, where it would be run.
NSErrorRef ProgramDrawer::checkProgram(const std::string& program) const {
  std::vector<std::string> words = confinement();
  bindProgram(program, words);
  words.insert(words.end(), {"--", "/bin/sh", "-c", "command -v \"$0\"", program});
  return run(words) ? NSError::errorWithErrno(ENOEXEC, program) : nullptr;
}

FileDescriptor ProgramDrawer::draw(const std::vector<std::string>& command, const std::string& path,
                                   const std::string& name, std::uint32_t side,
                                   NSErrorRef* error) const {
  std::call_once(*swept_, removeStaleResults);
  const ResultFile result;
  if (command.empty() || result.path().empty()) {
    storeError(error, NSError::errorWithErrno(command.empty() ? EINVAL : errno));
    return {};
  }
  const std::string input = "/input" + plainExtension(name);
  std::vector<std::string> words = confinement();
  bindProgram(command.front(), words);
  words.insert(words.end(), {"--ro-bind", path, input, "--bind", result.path(), kResult,
                             "--remount-ro", "/dev", "--remount-ro", "/", "--"});
  for (const std::string& word : command) words.push_back(filled(word, input, side));
  NSErrorRef failure = run(words);
  FileDescriptor drawn = failure ? FileDescriptor() : result.copy(options_.fileSize);
  if (drawn) return drawn;
  if (!failure) failure = nothingDrawn();
  // Was it the program's own answer?
  if (failure->is(NSCocoaErrorDomain, NSFileReadCorruptFileError)) {
    if (NSErrorRef missing = checkProgram(command.front())) failure = std::move(missing);
  }
  storeError(error, failure);
  return {};
}

}  // namespace yomber
