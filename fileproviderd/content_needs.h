#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "platform/foundation/error.h"

namespace yomber {

/// Who brings content here and gives it up: the extension. Thread-safety: loop thread only.
/// Handlers are called once each, never before the call returns.
class ContentSource {
 public:
  using Handler = std::function<void(NSErrorRef error)>;
  struct Request {
    std::string path;
    std::uint64_t options = 0;
    /// Whether anybody still wants it; to be looked at each time before it is begun, and not after
    /// it was answered.
    std::function<bool()> isWanted;
  };
  virtual ~ContentSource() = default;
  /// Answered when the content can be read, or could not be had; NSUserCancelledError when nobody
  /// wanted it any more.
  virtual void startProviding(const Request& request, Handler handler) = 0;
  virtual void stopProviding(const std::string& path, Handler handler) = 0;
  /// Whether the content is not here, whatever was said of it.
  virtual void isGone(const std::string& path, std::function<void(bool)> handler) = 0;
};

/// Counts who needs the content of which item. The content of an item is asked for once however
/// many need it, and nobody is asked to give up what somebody needs. Content that is found gone
/// again after it was granted is asked for again, a bounded number of times.
///
/// Thread-safety: loop thread only.
/// Ownership: shared; made with `create`. It may go before the needs that it gave.
class ContentNeeds : public std::enable_shared_from_this<ContentNeeds> {
 public:
  struct Limits {
    std::size_t needs = 65'536;
    int rounds = 8;  ///< how often content is asked for that keeps going
  };
  using Handler = ContentSource::Handler;

  /// Somebody's need of an item's content, until it is destroyed.
  class Need;
  using NeedRef = std::shared_ptr<Need>;

  /// `source` must outlive it.
  static std::shared_ptr<ContentNeeds> create(ContentSource& source, Limits limits);

  /// From now on the content is needed; `handler` is called once it can be read or cannot be had,
  /// unless the need is gone by then. Nil, and no call, when there are too many needs already.
  NeedRef need(const std::string& path, std::uint64_t options, Handler handler);
  /// Asks for the content to be given up, unless somebody needs it (EBUSY). `handler` is called
  /// when that has been seen to.
  void stop(const std::string& path, Handler handler);

  [[nodiscard]] std::size_t count() const { return count_; }

 private:
  using WishID = std::uint64_t;
  struct Wish {
    std::uint64_t options = 0;
    Handler handler;
  };
  /// What is known of one location; as long as anybody needs it or something is under way.
  struct Entry {
    enum class State : std::uint8_t { Idle, Providing, Stopping };
    State state = State::Idle;
    std::size_t needs = 0;
    std::map<WishID, Wish> waiting;
    std::set<WishID> asked;   ///< those among them that the request under way is for
    bool wasStopped = false;  ///< the request under way was given up
    bool isGivingUp = false;  ///< and that has not been answered yet
    bool isOver = false;      ///< the request itself has been answered
    int rounds = 0;           ///< of that request
    std::list<Handler> stops;
  };

  ContentNeeds(ContentSource& source, Limits limits) : source_(source), limits_(limits) {}

  void drop(const std::string& path, WishID wish);
  /// Does what is to be done next there, if anything is.
  void advance(const std::string& path);
  void provide(const std::string& path, Entry& entry);
  void giveUp(const std::string& path, Entry& entry);
  void didGiveUp(const std::string& path);
  void didProvide(const std::string& path, const NSErrorRef& error);
  void didLook(const std::string& path, bool isGone);
  void didStop(const std::string& path, const Handler& handler, const NSErrorRef& error);
  /// The request is over: answers those that it was for.
  void finish(const std::string& path, const NSErrorRef& error);

  ContentSource& source_;
  const Limits limits_;
  std::map<std::string, Entry> entries_;
  std::size_t count_ = 0;
  WishID lastWish_ = 0;
};

class ContentNeeds::Need {
 public:
  Need(std::weak_ptr<ContentNeeds> needs, std::string path, WishID wish);
  ~Need();
  Need(const Need&) = delete;
  Need& operator=(const Need&) = delete;

 private:
  const std::weak_ptr<ContentNeeds> needs_;
  const std::string path_;
  const WishID wish_;
};

}  // namespace yomber
