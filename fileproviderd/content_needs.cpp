#include "fileproviderd/content_needs.h"

#include <cerrno>
#include <utility>
#include <vector>

namespace yomber {
namespace {

NSErrorRef neededError(const std::string& path) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EBUSY,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey, "somebody needs the content of " + path + " at the moment"}});
}

NSErrorRef elusiveError(const std::string& path) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey,
        "the content of " + path + " goes again as soon as it is here"}});
}

}  // namespace

ContentNeeds::Need::Need(std::weak_ptr<ContentNeeds> needs, std::string path, WishID wish)
    : needs_(std::move(needs)), path_(std::move(path)), wish_(wish) {}

ContentNeeds::Need::~Need() {
  if (const auto needs = needs_.lock()) needs->drop(path_, wish_);
}

std::shared_ptr<ContentNeeds> ContentNeeds::create(ContentSource& source, Limits limits) {
  return std::shared_ptr<ContentNeeds>(new ContentNeeds(source, limits));
}

ContentNeeds::NeedRef ContentNeeds::need(const std::string& path, std::uint64_t options,
                                         Handler handler) {
  if (count_ >= limits_.needs) return nullptr;
  const WishID wish = ++lastWish_;
  Entry& entry = entries_[path];
  ++entry.needs;
  ++count_;
  entry.waiting.emplace(wish, Wish{options, std::move(handler)});
  auto made = std::make_shared<Need>(weak_from_this(), path, wish);
  advance(path);
  return made;
}

void ContentNeeds::drop(const std::string& path, WishID wish) {
  Entry& entry = entries_.at(path);
  --entry.needs;
  --count_;
  entry.waiting.erase(wish);
  entry.asked.erase(wish);
  if (entry.needs == 0 && entry.state == Entry::State::Providing) giveUp(path, entry);
  advance(path);
}

void ContentNeeds::giveUp(const std::string& path, Entry& entry) {
  if (std::exchange(entry.wasStopped, true)) return;
  entry.isGivingUp = true;
  source_.stopProviding(path, [weak = weak_from_this(), path](const NSErrorRef&) {
    if (const auto self = weak.lock()) self->didGiveUp(path);
  });
}

void ContentNeeds::didGiveUp(const std::string& path) {
  Entry& entry = entries_.at(path);
  entry.isGivingUp = false;
  if (entry.isOver) finish(path, nullptr);
}

void ContentNeeds::stop(const std::string& path, Handler handler) {
  const auto found = entries_.find(path);
  if (found != entries_.end() && found->second.needs > 0) return handler(neededError(path));
  entries_[path].stops.push_back(std::move(handler));
  advance(path);
}

void ContentNeeds::advance(const std::string& path) {
  const auto found = entries_.find(path);
  if (found == entries_.end() || found->second.state != Entry::State::Idle) return;
  Entry& entry = found->second;
  if (entry.needs > 0) {
    for (const auto& handler : std::exchange(entry.stops, {})) handler(neededError(path));
  }
  if (!entry.waiting.empty()) return provide(path, entry);
  if (entry.stops.empty()) {
    if (entry.needs == 0) entries_.erase(found);
    return;
  }
  entry.state = Entry::State::Stopping;
  auto handler = std::move(entry.stops.front());
  entry.stops.pop_front();
  source_.stopProviding(
      path, [weak = weak_from_this(), path, handler = std::move(handler)](const NSErrorRef& error) {
        if (const auto self = weak.lock()) self->didStop(path, handler, error);
      });
}

void ContentNeeds::didStop(const std::string& path, const Handler& handler,
                           const NSErrorRef& error) {
  entries_.at(path).state = Entry::State::Idle;
  handler(error);
  advance(path);
}

void ContentNeeds::provide(const std::string& path, Entry& entry) {
  entry.state = Entry::State::Providing;
  entry.wasStopped = false;
  entry.isOver = false;
  ContentSource::Request request;
  request.path = path;
  for (const auto& [wish, wanted] : entry.waiting) {
    request.options |= wanted.options;
    entry.asked.insert(wish);
  }
  request.isWanted = [weak = weak_from_this(), path] {
    const auto self = weak.lock();
    return self != nullptr && !self->entries_.at(path).wasStopped;
  };
  source_.startProviding(request, [weak = weak_from_this(), path](const NSErrorRef& error) {
    if (const auto self = weak.lock()) self->didProvide(path, error);
  });
}

void ContentNeeds::didProvide(const std::string& path, const NSErrorRef& error) {
  Entry& entry = entries_.at(path);
  // Whoever came after it was given up gets a request of their own.
  if (entry.wasStopped || error != nullptr) return finish(path, error);
  source_.isGone(path, [weak = weak_from_this(), path](bool isGone) {
    if (const auto self = weak.lock()) self->didLook(path, isGone);
  });
}

void ContentNeeds::didLook(const std::string& path, bool isGone) {
  Entry& entry = entries_.at(path);
  if (!isGone) return finish(path, nullptr);
  if (entry.wasStopped || ++entry.rounds >= limits_.rounds) return finish(path, elusiveError(path));
  provide(path, entry);
}

void ContentNeeds::finish(const std::string& path, const NSErrorRef& error) {
  Entry& entry = entries_.at(path);
  entry.isOver = true;
  // Until then, whoever is granted the content next would lose it again. Nobody waits for this
  // request any more.
  if (entry.isGivingUp) return;
  std::vector<Handler> handlers;
  for (const WishID wish : std::exchange(entry.asked, {})) {
    const auto found = entry.waiting.find(wish);
    handlers.push_back(std::move(found->second.handler));
    entry.waiting.erase(found);
  }
  entry.rounds = 0;
  entry.state = Entry::State::Idle;
  for (const auto& handler : handlers) handler(error);
  advance(path);
}

}  // namespace yomber
