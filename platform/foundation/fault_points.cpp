#include "platform/foundation/fault_points.h"

#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <utility>

#include "platform/foundation/lock.h"

namespace yomber {

namespace {

struct FaultAction {
  enum class Kind { Abort, Error, Pause, PauseFirst, PauseEach };
  Kind kind = Kind::Error;
  std::string file;
};

constexpr std::string_view kPausePrefix = "pause-until-file:";
constexpr std::string_view kPauseFirstPrefix = "pause-first-until-file:";
constexpr std::string_view kPauseEachPrefix = "pause-each-until-file:";

std::optional<FaultAction> parseAction(std::string_view text) {
  if (text == "abort") return FaultAction{.kind = FaultAction::Kind::Abort, .file = {}};
  if (text == "error") return FaultAction{.kind = FaultAction::Kind::Error, .file = {}};
  for (const auto& [prefix, kind] : {std::pair(kPausePrefix, FaultAction::Kind::Pause),
                                     std::pair(kPauseFirstPrefix, FaultAction::Kind::PauseFirst),
                                     std::pair(kPauseEachPrefix, FaultAction::Kind::PauseEach)}) {
    if (text.starts_with(prefix) && text.size() > prefix.size())
      return FaultAction{.kind = kind, .file = std::string(text.substr(prefix.size()))};
  }
  return std::nullopt;
}

using FaultActions = std::map<std::string, FaultAction, std::less<>>;

std::optional<FaultActions> parseFaults(std::string_view faults) {
  FaultActions result;
  while (!faults.empty()) {
    const auto comma = faults.find(',');
    const std::string_view entry = faults.substr(0, comma);
    faults = comma == std::string_view::npos ? std::string_view{} : faults.substr(comma + 1);
    const auto equals = entry.find('=');
    if (equals == std::string_view::npos || equals == 0) return std::nullopt;
    auto action = parseAction(entry.substr(equals + 1));
    if (!action) return std::nullopt;
    result[std::string(entry.substr(0, equals))] = std::move(*action);
  }
  return result;
}

/// Whether nobody was there before.
bool noteReached(const std::string& file) {
  const std::string reached = file + ".reached";
  const int descriptor = open(reached.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0600);
  if (descriptor >= 0) close(descriptor);
  return descriptor >= 0;
}

void waitForFile(const std::string& file) {
  while (access(file.c_str(), F_OK) != 0) {
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

}  // namespace

/// The points of this process and what is armed.
class FaultPointRegistry {
 public:
  static FaultPointRegistry& shared() {
    static auto* const registry = new FaultPointRegistry;  // points outlive every static
    return *registry;
  }

  void add(FaultPoint* point) {
    LockGuard guard(mutex_);
    points_.insert(point);
    point->armed_.store(actions_.contains(std::string_view(point->name_)));
  }
  void remove(FaultPoint* point) {
    LockGuard guard(mutex_);
    points_.erase(point);
  }
  void arm(FaultActions actions) {
    LockGuard guard(mutex_);
    actions_.merge(actions);
    for (auto& [name, action] : actions) actions_[name] = std::move(action);
    refresh();
  }
  void disarmAll() {
    LockGuard guard(mutex_);
    actions_.clear();
    refresh();
  }
  std::optional<FaultAction> action(const char* name) {
    LockGuard guard(mutex_);
    const auto found = actions_.find(std::string_view(name));
    if (found == actions_.end()) return std::nullopt;
    return found->second;
  }

 private:
  FaultPointRegistry() {
    const char* const faults = std::getenv("YOMBER_FAULTS");
    if (faults == nullptr) return;
    auto parsed = parseFaults(faults);
    if (!parsed) {
      std::fprintf(stderr, "YOMBER_FAULTS is malformed and ignored: %s\n", faults);
      return;
    }
    actions_ = std::move(*parsed);
  }
  void refresh() REQUIRES(mutex_) {
    for (auto* point : points_) {
      point->armed_.store(actions_.contains(std::string_view(point->name_)));
    }
  }

  Mutex mutex_;
  FaultActions actions_ GUARDED_BY(mutex_);
  std::set<FaultPoint*> points_ GUARDED_BY(mutex_);
};

FaultPoint::FaultPoint(const char* name) : name_(name) { FaultPointRegistry::shared().add(this); }

FaultPoint::~FaultPoint() { FaultPointRegistry::shared().remove(this); }

bool FaultPoint::act() {
  const auto action = FaultPointRegistry::shared().action(name_);
  if (!action) return false;
  switch (action->kind) {
    case FaultAction::Kind::Abort:
      std::abort();
    case FaultAction::Kind::Pause:
      (void)noteReached(action->file);
      waitForFile(action->file);
      return false;
    case FaultAction::Kind::PauseFirst:
      if (noteReached(action->file)) waitForFile(action->file);
      return false;
    case FaultAction::Kind::PauseEach:
      (void)noteReached(action->file);
      waitForFile(action->file);
      // In this order: where the file is gone, what is noted is the next one's.
      unlink((action->file + ".reached").c_str());
      unlink(action->file.c_str());
      return false;
    case FaultAction::Kind::Error:
      break;
  }
  return true;
}

NSErrorRef FaultPoint::arm(std::string_view faults) {
  auto parsed = parseFaults(faults);
  if (!parsed) {
    return NSError::errorWithDomain(
        NSPOSIXErrorDomain, EINVAL,
        {{NSLocalizedDescriptionKey,
          "faults are written name=abort, name=error, name=pause-until-file:PATH, "
          "name=pause-first-until-file:PATH or name=pause-each-until-file:PATH, with commas "
          "between them: " +
              std::string(faults)}});
  }
  FaultPointRegistry::shared().arm(std::move(*parsed));
  return nullptr;
}

void FaultPoint::disarmAll() { FaultPointRegistry::shared().disarmAll(); }

}  // namespace yomber
