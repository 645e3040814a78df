#include "platform/foundation/drive_paths.h"

#include <openssl/sha.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <span>
#include <vector>

#include "platform/foundation/hexadecimal.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

/// Whether missing directories are made or are a failure.
enum class Missing { Make, Refuse };

constexpr std::size_t kSocketPathRoom = sizeof(sockaddr_un::sun_path);

NSErrorRef failure(int number, const std::string& path, const std::string& text) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, number,
      {{NSFilePathErrorKey, path}, {NSLocalizedDescriptionKey, path + ": " + text}});
}

NSErrorRef systemFailure(const std::string& path) {
  const int number = errno;
  return failure(number, path, NSError::errorWithErrno(number)->localizedDescription());
}

/// The variable's value when it is an absolute path; relative ones are to be ignored.
std::string absoluteFromEnvironment(const char* name) {
  const char* const value = std::getenv(name);
  return value != nullptr && value[0] == '/' ? value : "";
}

std::string userDirectory() {
  if (auto home = absoluteFromEnvironment("HOME"); !home.empty()) return home;
  std::array<char, 4096> buffer{};
  passwd entry{};
  passwd* found = nullptr;
  if (getpwuid_r(geteuid(), &entry, buffer.data(), buffer.size(), &found) != 0 || !found)
    return "/";
  return found->pw_dir;
}

std::string canonical(std::string_view home) {
  std::error_code ignored;
  const fs::path absolute = fs::absolute(fs::path(home), ignored);
  const fs::path resolved = fs::weakly_canonical(absolute, ignored);
  std::string out = (ignored ? absolute.lexically_normal() : resolved).string();
  while (out.size() > 1 && out.back() == '/') out.pop_back();
  return out;
}

std::string hashOf(const std::string& text) {
  std::array<unsigned char, SHA256_DIGEST_LENGTH> digest{};
  SHA256(reinterpret_cast<const unsigned char*>(text.data()), text.size(), digest.data());
  return hexadecimal(std::as_bytes(std::span(digest).first<8>()));
}

/// Checks what stands at `path` itself; a symbolic link is never followed.
NSErrorRef checkOwnDirectory(const std::string& path) {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0) return systemFailure(path);
  if (S_ISLNK(status.st_mode)) {
    return failure(ENOTDIR, path, "is a symbolic link; a drive needs a directory there");
  }
  if (!S_ISDIR(status.st_mode)) {
    return failure(ENOTDIR, path, "is no directory; move it away, or choose another home");
  }
  if (status.st_uid != geteuid()) {
    return failure(EPERM, path, "belongs to another user; choose another home");
  }
  if ((status.st_mode & 077U) != 0) {
    return failure(EPERM, path, "is open to other users; close it with 'chmod 700 " + path + "'");
  }
  return nullptr;
}

NSErrorRef provide(const std::string& path, Missing missing) {
  if (missing == Missing::Make && mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) {
    return systemFailure(path);
  }
  return checkOwnDirectory(path);
}

/// The directories above `path`. They may be anybody's, like /home.
NSErrorRef provideParents(const std::string& path, Missing missing) {
  if (missing == Missing::Refuse) return nullptr;
  for (std::size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    const std::string parent = path.substr(0, slash);
    if (mkdir(parent.c_str(), 0700) != 0 && errno != EEXIST) {
      // Not allowed to make what is there already: a read-only or foreign directory on the way.
      if (access(parent.c_str(), X_OK) != 0) return systemFailure(parent);
    }
  }
  return nullptr;
}

NSErrorRef provideWithParents(const std::string& path) {
  if (auto error = provideParents(path, Missing::Make)) return error;
  return provide(path, Missing::Make);
}

NSErrorRef checkSocketPath(const std::string& path) {
  if (path.size() < kSocketPathRoom) return nullptr;
  return failure(ENAMETOOLONG, path,
                 "is too long for a socket (" + std::to_string(path.size()) + " bytes of at most " +
                     std::to_string(kSocketPathRoom - 1) +
                     "); set XDG_RUNTIME_DIR to a short path, or choose a shorter home");
}

/// $XDG_RUNTIME_DIR must be there: nobody but the session's manager makes it.
NSErrorRef checkSessionDirectory(const std::string& path) {
  struct stat status{};
  if (stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode)) return nullptr;
  return failure(ENOENT, path,
                 "is what XDG_RUNTIME_DIR names, and no such directory exists; unset the variable "
                 "to keep sockets in the drive's home");
}

std::string ownStore(const std::string& home) { return home + "/store"; }

/// A drive that has joined another store has a link in place of its own.
std::string storeOf(const std::string& home) {
  std::error_code isNoLink;
  const fs::path target = fs::read_symlink(ownStore(home), isNoLink);
  return isNoLink || !target.is_absolute() ? ownStore(home) : target.string();
}

/// Never made anew: it may be on a disk that is away, and an empty one would pass for a store that
/// has lost everything.
NSErrorRef checkJoinedStore(const std::string& path) {
  struct stat status{};
  if (lstat(path.c_str(), &status) != 0 && errno == ENOENT)
    return failure(ENOENT, path,
                   "is where the drive's record store is, and nothing is there; "
                   "mount the disk that it is on");
  return checkOwnDirectory(path);
}

NSErrorRef provideAll(const DrivePaths& paths, Missing missing) {
  for (const auto& socket : {paths.daemonSocket, paths.controlSocket}) {
    if (auto error = checkSocketPath(socket)) return error;
  }
  if (auto error = provideParents(paths.home, missing)) return error;
  std::vector<std::string> directories{paths.home, paths.tree, paths.privateDirectory, paths.log};
  if (paths.store == ownStore(paths.home)) {
    directories.push_back(paths.store);
  } else if (auto error = checkJoinedStore(paths.store)) {
    return error;
  }
  const auto session = absoluteFromEnvironment("XDG_RUNTIME_DIR");
  if (!paths.runtimeDirectory.starts_with(paths.home + "/")) {
    if (auto error = checkSessionDirectory(session)) return error;
    directories.push_back(paths.runtimeDirectory.substr(0, paths.runtimeDirectory.rfind('/')));
  }
  directories.push_back(paths.runtimeDirectory);
  for (const auto& directory : directories) {
    if (auto error = provide(directory, missing)) return error;
  }
  return nullptr;
}

}  // namespace

DrivePaths DrivePaths::forHome(std::string_view home) {
  DrivePaths paths;
  paths.home = canonical(home);
  paths.homeHash = hashOf(paths.home);
  paths.tree = paths.home + "/tree";
  paths.privateDirectory = paths.home + "/private";
  paths.database = paths.home + "/zarn.db";
  paths.store = storeOf(paths.home);
  paths.log = paths.home + "/log";
  const auto session = absoluteFromEnvironment("XDG_RUNTIME_DIR");
  paths.runtimeDirectory =
      session.empty() ? paths.home + "/run" : session + "/yomber/" + paths.homeHash;
  paths.daemonSocket = paths.runtimeDirectory + "/zarn.sock";
  paths.controlSocket = paths.runtimeDirectory + "/control.sock";
  paths.logLevelPage = paths.runtimeDirectory + "/log-level";
  return paths;
}

DrivePaths DrivePaths::forDefaultHome() {
  const char* const chosen = std::getenv("YOMBER_HOME");
  if (chosen != nullptr && chosen[0] != '\0') return forHome(chosen);
  const auto data = absoluteFromEnvironment("XDG_DATA_HOME");
  return forHome((data.empty() ? userDirectory() + "/.local/share" : data) + "/yomber");
}

NSErrorRef DrivePaths::create() const { return provideAll(*this, Missing::Make); }

NSErrorRef DrivePaths::check() const { return provideAll(*this, Missing::Refuse); }

NSErrorRef DrivePaths::joinStore(std::string_view directory) {
  const std::string joined = canonical(directory);
  if (joined == store) return checkJoinedStore(store);
  if (const auto error = provideWithParents(joined)) return error;
  if (const auto error = provideWithParents(home)) return error;
  const std::string own = ownStore(home);
  if (store != own || (rmdir(own.c_str()) != 0 && errno != ENOENT))
    return failure(EEXIST, store,
                   "is the drive's record store already; a drive keeps the one that it began with");
  if (symlink(joined.c_str(), own.c_str()) != 0) return systemFailure(own);
  store = joined;
  return nullptr;
}

}  // namespace yomber
