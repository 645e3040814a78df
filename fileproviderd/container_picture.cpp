#include "fileproviderd/container_picture.h"

#include <functional>
#include <string_view>

namespace yomber {
namespace {

/// Combines values in order; each step is a bijection of the state for a given value.
class Fingerprint {
 public:
  void add(std::uint64_t value) {
    state_ = (state_ ^ value) * 0x9E3779B97F4A7C15ULL;
    state_ ^= state_ >> 29U;
  }
  void add(std::string_view text) { add(std::hash<std::string_view>{}(text)); }
  void add(NSDate date) { add(static_cast<std::uint64_t>(date.nanoseconds())); }
  [[nodiscard]] std::uint64_t value() const { return state_; }

 private:
  std::uint64_t state_ = 0xD1B54A32D192ED03ULL;
};

}  // namespace

std::uint64_t itemFingerprint(const ItemFields& item) {
  Fingerprint print;
  print.add(item.parentIdentifier);
  print.add(item.filename);
  print.add(item.contentType);
  print.add(static_cast<std::uint64_t>(item.kind));
  print.add(item.rawID);
  print.add(item.size);
  print.add(item.creationDate);
  print.add(item.modificationDate);
  print.add(static_cast<std::uint64_t>(item.lastUsedDate.has_value()));
  print.add(item.lastUsedDate.value_or(NSDate()));
  print.add(static_cast<std::uint64_t>(item.favoriteRank.has_value()));
  print.add(static_cast<std::uint64_t>(item.favoriteRank.value_or(0)));
  print.add(item.tags.size());
  for (const auto& tag : item.tags) print.add(tag);
  print.add((static_cast<std::uint64_t>(item.capabilities) << 32U) | item.flags);
  print.add(item.version);
  print.add(item.childCount);
  print.add(item.containerID);
  return print.value();
}

ContainerPicture::Change ContainerPicture::store(const ItemFields& item) {
  const State now{itemFingerprint(item), item.rank, generation_};
  const auto [place, isNew] = states_.try_emplace(item.identifier, now);
  if (isNew) return Change::New;
  const bool isSame = place->second.fingerprint == now.fingerprint;
  place->second = now;
  return isSame ? Change::Unchanged : Change::Changed;
}

ContainerPicture::Change ContainerPicture::didList(const ItemFields& item) { return store(item); }

ContainerPicture::Change ContainerPicture::didUpdate(const ItemFields& item) {
  const auto known = states_.find(item.identifier);
  // Ranks are only comparable within one listing: a rebuilt database starts counting anew.
  if (known != states_.end() && known->second.generation == generation_ && item.rank != 0 &&
      item.rank < known->second.rank) {
    return Change::Outdated;
  }
  return store(item);
}

std::vector<std::string> ContainerPicture::endListing() {
  std::vector<std::string> gone;
  for (auto state = states_.begin(); state != states_.end();) {
    if (state->second.generation == generation_) {
      ++state;
      continue;
    }
    gone.push_back(state->first);
    state = states_.erase(state);
  }
  return gone;
}

std::vector<std::string> ContainerPicture::clear() {
  std::vector<std::string> gone;
  gone.reserve(states_.size());
  for (const auto& [identifier, state] : states_) gone.push_back(identifier);
  states_.clear();
  return gone;
}

}  // namespace yomber
