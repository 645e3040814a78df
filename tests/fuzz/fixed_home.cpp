#include "tests/fuzz/fixed_home.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "tests/fuzz/expect.h"

namespace yomber::fuzz {

void claimHome(const std::string& path) {
  const std::string lockPath = path + ".lock";
  // Held until the process ends.
  const int lock =
      open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, S_IRUSR | S_IWUSR);
  expect(lock >= 0 && flock(lock, LOCK_EX | LOCK_NB) == 0,
         "this target runs once at a time, and its lock below /tmp is this user's");
  std::error_code failure;
  std::filesystem::remove_all(path, failure);
  expect(mkdir(path.c_str(), S_IRWXU) == 0, "the home below /tmp can be made anew");
}

}  // namespace yomber::fuzz
