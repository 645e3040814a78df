#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/fileprovider/thumbnail.h"
#include "protocols/thumbnails.capnp.h"

namespace yomber {

/// Takes the thumbnails that a host tells of, for as long as it lives: a call may come after that.
///
/// Thread-safety: one thread; not the loop thread for the end, which waits for what is being taken.
class ThumbnailTaker {
 public:
  /// Called on threads of the pool, for one thumbnail at a time.
  using Take = std::function<void(const ItemThumbnail& thumbnail)>;
  /// `queueName` is the queue's on which thumbnails are taken.
  ThumbnailTaker(const std::string& queueName, Take take);
  ~ThumbnailTaker();
  ThumbnailTaker(const ThumbnailTaker&) = delete;
  ThumbnailTaker& operator=(const ThumbnailTaker&) = delete;

  /// What the host is given to tell. Loop thread only.
  [[nodiscard]] protocol::ThumbnailReceiver::Client receiver() const;

 private:
  class State;
  class Receiver;

  const std::shared_ptr<State> state_;
};

}  // namespace yomber
