#include "mount/places.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <iterator>

namespace yomber {

std::unique_ptr<Places> Places::open(const std::string& root, const std::string& trash,
                                     NSErrorRef* error) {
  std::unique_ptr<Places> places(new Places());
  std::uint32_t number = 0;
  NSErrorRef failure = places->addBase(root, number);
  if (!failure) failure = places->addBase(trash, number);
  if (failure) {
    storeError(error, std::move(failure));
    return nullptr;
  }
  places->trashName_ = ".Trash-" + std::to_string(getuid());
  places->forgetShown();
  return places;
}

NSErrorRef Places::addBase(const std::string& path, std::uint32_t& number) {
  LockGuard guard(mutex_);
  FileDescriptor folder(::open(path.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct statx status{};
  const int failure = folder ? lookAt(folder.get(), "", status) : errno;
  if (failure != 0) return NSError::errorWithErrno(failure, path);
  // One that was removed and made again is another.
  for (number = 0; number < bases_.size(); ++number) {
    const bool isSame = bases_[number].identity == FileIdentity::of(status);
    if (isSame && bases_[number].path == path) return nullptr;
  }
  bases_.push_back({path, std::move(folder), FileIdentity::of(status)});
  return nullptr;
}

const Places::Base& Places::base(std::uint32_t number) const {
  LockGuard guard(mutex_);
  return bases_.at(number);
}

std::optional<std::uint32_t> Places::shownBase(std::string_view name) const {
  LockGuard guard(mutex_);
  const auto found = shownBases_.find(name);
  if (found == shownBases_.end()) return std::nullopt;
  return found->second;
}

std::vector<Places::ShownBase> Places::shownBases() const {
  LockGuard guard(mutex_);
  std::vector<ShownBase> result;
  for (const auto& [name, base] : shownBases_) result.push_back({name, base});
  return result;
}

std::string Places::shownNameOfBase(std::uint32_t number) const {
  LockGuard guard(mutex_);
  for (const auto& [name, base] : shownBases_) {
    if (base == number) return name;
  }
  return {};
}

void Places::showContainer(const std::string& location, const std::string& name) {
  std::uint32_t number = 0;
  const NSErrorRef failure = addBase(location, number);
  if (!failure && number <= kTrash) return;
  LockGuard guard(mutex_);
  for (auto shown = shownBases_.begin(); shown != shownBases_.end();) {
    shown = bases_[shown->second].path == location ? shownBases_.erase(shown) : std::next(shown);
  }
  if (!failure && !name.empty()) shownBases_.insert_or_assign(name, number);
}

void Places::showName(std::uint64_t folder, const std::string& diskName, const std::string& name) {
  LockGuard guard(mutex_);
  if (const auto before = shownByDisk_.find({folder, diskName}); before != shownByDisk_.end()) {
    // Unless another entry is shown under that name by now.
    const auto shown = diskByShown_.find({folder, before->second});
    if (shown != diskByShown_.end() && shown->second == diskName) diskByShown_.erase(shown);
    shownByDisk_.erase(before);
  }
  if (!name.empty() && name != diskName) {
    shownByDisk_[{folder, diskName}] = name;
    diskByShown_[{folder, name}] = diskName;
  }
  hasShownNames_ = !shownByDisk_.empty();
}

void Places::forgetShown() {
  LockGuard guard(mutex_);
  shownBases_.clear();
  shownBases_[trashName_] = kTrash;
  shownByDisk_.clear();
  diskByShown_.clear();
  hasShownNames_ = false;
}

std::string Places::nameOnDisk(std::uint64_t folder, std::string_view shownName) const {
  if (!hasShownNames_) return std::string(shownName);
  LockGuard guard(mutex_);
  const auto found = diskByShown_.find({folder, std::string(shownName)});
  return found == diskByShown_.end() ? std::string(shownName) : found->second;
}

std::string Places::shownName(std::uint64_t folder, std::string_view nameOnDisk) const {
  if (!hasShownNames_) return std::string(nameOnDisk);
  LockGuard guard(mutex_);
  const auto found = shownByDisk_.find({folder, std::string(nameOnDisk)});
  return found == shownByDisk_.end() ? std::string(nameOnDisk) : found->second;
}

}  // namespace yomber
