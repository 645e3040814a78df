// Renames, moves, trashings and removals of many items through host, extension and daemon, as many
// under way at a time as the command line has, each beside the bare system calls on as many files;
// and what the daemon does, and has used, when all is over.

#include <cstdio>
#include <filesystem>
#include <functional>
#include <stdexcept>
#include <string>
#include <vector>

#include <poll.h>
#include <unistd.h>

#include "benchmarks/figure.h"
#include "benchmarks/many_files.h"
#include "benchmarks/process_use.h"
#include "benchmarks/quiet_drive.h"
#include "platform/fileprovider/constants.h"
#include "platform/foundation/lock.h"
#include "tests/harness/test_drive.h"
#include "yomber/drive_changes.h"
#include "yomber/drive_client.h"
#include "yomber/side_by_side.h"

namespace {

using namespace yomber;
namespace fs = std::filesystem;

constexpr std::size_t kAtATime = 16;
constexpr std::chrono::minutes kPatience{10};

void require(bool isDone, const std::string& text) {
  if (!isDone) throw std::runtime_error(text);
}

/// One file of the drive, and one beside it.
struct Item {
  std::string identifier;
  std::string name;
};

class Operations {
 public:
  Operations() {
    drive_.up();
    NSErrorRef error;
    changes_ = DriveChanges::open(client_, &error);
    require(changes_.has_value(), "the drive is not up");
  }

  /// All four, of as many files.
  void run(const std::string& name, std::size_t count) {
    const std::string beside = fs::path(drive_.home()).parent_path() / name;
    std::vector<Item> items = make(name, count);
    make(beside, items);
    const std::string other = makeFolder("other " + name);
    const auto old = [](const std::string& folder, const Item& item) {
      return folder + "/old/" + item.name;
    };
    const auto renamed = [](const std::string& folder, const Item& item) {
      return folder + "/old/renamed " + item.name;
    };
    measure(
        rename_, items,
        [&](const Item& item) {
          return changes_->rename(item.identifier, "renamed " + item.name).error;
        },
        [&](const Item& item) {
          return ::rename(old(beside, item).c_str(), renamed(beside, item).c_str());
        });
    measure(
        move_, items,
        [&](const Item& item) {
          return changes_->reparent(item.identifier, other, std::nullopt).error;
        },
        [&](const Item& item) {
          return ::rename(renamed(beside, item).c_str(), (beside + "/new/" + item.name).c_str());
        });
    measure(
        trash_, items, [&](const Item& item) { return changes_->trash(item.identifier).error; },
        [&](const Item& item) {
          return ::rename((beside + "/new/" + item.name).c_str(),
                          (beside + "/trash/" + item.name).c_str());
        });
    measure(
        remove_, items, [&](const Item& item) { return changes_->remove(item.identifier).error; },
        [&](const Item& item) { return unlink((beside + "/trash/" + item.name).c_str()); });
  }

  void print() const {
    const std::string yardstick = "bare calls";
    const auto any = [](double) { return true; };
    bench::print(rename_.figure("rename", "items/s", yardstick, "", any));
    bench::print(move_.figure("move", "items/s", yardstick, "", any));
    bench::print(trash_.figure("trash", "items/s", yardstick, "", any));
    bench::print(remove_.figure("delete", "items/s", yardstick, "", any));
  }

  /// What is left when all is done: nothing is to be used without a reason.
  [[nodiscard]] bool printRest() {
    bench::waitUntilQuiet(drive_);
    const pid_t zarn = drive_.pidOf(testing::TestDrive::Process::Zarn);
    const pid_t extension = drive_.pidOf(testing::TestDrive::Process::Extension);
    constexpr int kIdleSeconds = 10;
    const double before = bench::processorSeconds(zarn) + bench::processorSeconds(extension);
    (void)poll(nullptr, 0, kIdleSeconds * 1000);
    const double after = bench::processorSeconds(zarn) + bench::processorSeconds(extension);
    bool isReached = print("processor time of zarn and extension in 10 idle seconds",
                           (after - before) * 1000, "ms", 20);
    isReached &= print("peak memory of zarn", bench::peakMebibytes(zarn), "MiB", 60);
    isReached &= print("peak memory of the extension", bench::peakMebibytes(extension), "MiB", 30);
    return isReached;
  }

 private:
  [[nodiscard]] static bool print(const char* name, double value, const char* unit, double most) {
    bench::Figure figure;
    figure.name = name;
    figure.value = value;
    figure.unit = unit;
    figure.goal = "at most " + std::to_string(static_cast<int>(most)) + " " + unit;
    figure.reached = value <= most;
    bench::print(figure);
    return figure.reached;
  }

  /// Files in a folder of the drive, and what they are called there.
  std::vector<Item> make(const std::string& name, std::size_t count) {
    drive_.makeFolder(name);
    bench::makeFiles(drive_.root() + "/" + name, count);
    std::vector<Item> items;
    const auto areThere = [&] {
      std::string folder;
      items.clear();
      if (client_.identifierFor(name, folder)) return false;
      const NSErrorRef error =
          client_.list(folder, protocol::SortOrder::NAME, [&](const auto& page) {
            for (const ItemFields& item : page) items.push_back({item.identifier, item.filename});
            return true;
          });
      return !error && items.size() == count;
    };
    require(testing::eventually(areThere, kPatience), "the files are not all seen");
    bench::waitUntilQuiet(drive_);
    return items;
  }

  /// The same files again, where no drive is.
  static void make(const std::string& folder, const std::vector<Item>& items) {
    for (const char* each : {"/old", "/new", "/trash"}) fs::create_directories(folder + each);
    bench::makeFiles(folder + "/old", items.size());
  }

  std::string makeFolder(const std::string& name) {
    const ChangeResult made =
        changes_->createDirectory(name, NSFileProviderRootContainerItemIdentifier);
    require(made.item.has_value(), "no folder can be made");
    return made.item->identifier;
  }

  void measure(bench::Repeated& measured, const std::vector<Item>& items,
               const std::function<NSErrorRef(const Item& item)>& change,
               const std::function<int(const Item& item)>& bare) {
    const auto count = static_cast<double>(items.size());
    Mutex mutex;
    std::string failure;
    const double seconds = bench::secondsFor([&] {
      sideBySide(items.size(), kAtATime, [&](std::size_t index) {
        const NSErrorRef error = change(items[index]);
        LockGuard guard(mutex);
        if (error) failure = error->description();
      });
    });
    require(failure.empty(), failure);
    const double bareSeconds = bench::secondsFor([&] {
      for (const Item& item : items) require(bare(item) == 0, item.name + ": the bare call failed");
    });
    measured.add(count / seconds, count / bareSeconds);
  }

  testing::TestDrive drive_;
  DriveClient client_{DrivePaths::forHome(drive_.home())};
  std::optional<DriveChanges> changes_;
  bench::Repeated rename_;
  bench::Repeated move_;
  bench::Repeated trash_;
  bench::Repeated remove_;
};

}  // namespace

int main() {
  const std::size_t count = bench::sizeFromEnvironment("YOMBER_BENCH_CHANGED_ITEMS", 10'000);
  const std::size_t rounds = bench::sizeFromEnvironment("YOMBER_BENCH_ROUNDS", 3);
  Operations operations;
  for (std::size_t round = 0; round < rounds; ++round) {
    operations.run("items " + std::to_string(round), count);
  }
  operations.print();
  return operations.printRest() ? 0 : 1;
}
