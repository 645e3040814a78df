#pragma once

#include <functional>
#include <memory>
#include <string>

namespace yomber {

/// Posts notifications by name to whoever registered for them.
///
/// Observers are held weakly and named by their object address; an observer that is destroyed
/// receives nothing more. `post` runs the handlers on the posting thread, over a weak snapshot,
/// with no lock held; a handler may add and remove observers. A handler already running when
/// `removeObserver` returns may still finish.
///
/// Thread-safety: every operation may be called on any thread but the loop thread for `post`.
class NSNotificationCenter {
 public:
  using Handler = std::function<void()>;

  static NSNotificationCenter& defaultCenter();

  /// Registers `handler` for `name` on behalf of `observer`. The handler must not keep the observer
  /// alive; it is called only while the observer is.
  void addObserver(const std::shared_ptr<const void>& observer, const std::string& name,
                   Handler handler);
  /// Removes the observer for every name, or only for `name`.
  void removeObserver(const void* observer);
  void removeObserver(const void* observer, const std::string& name);
  void postNotificationName(const std::string& name);

  NSNotificationCenter();
  ~NSNotificationCenter();

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace yomber
