#pragma once

#include <string>

#include "platform/foundation/error.h"

namespace yomber {

/// To be called first by the body that an optional method of a protocol has where objects leave it
/// out. While a message is delivered to the object, its caller then gets
/// NSXPCConnectionReplyInvalid from the connection, which stays; whatever the body replies
/// afterwards is dropped. Answers the error for a caller in this process.
NSErrorRef NSXPCMethodIsLeftOut(const std::string& method);

/// A message that is being delivered on this thread. Frames nest, the innermost first.
class DeliveredMessage {
 public:
  DeliveredMessage(const DeliveredMessage&) = delete;
  DeliveredMessage& operator=(const DeliveredMessage&) = delete;
  virtual ~DeliveredMessage() = default;
  /// The object has no such method.
  virtual void leaveOut(const std::string& text) = 0;

  /// Delivers it on this thread while it lives.
  class Frame {
   public:
    explicit Frame(DeliveredMessage& message);
    ~Frame();
    Frame(const Frame&) = delete;
    Frame& operator=(const Frame&) = delete;

   private:
    DeliveredMessage* const outer_;
  };

 protected:
  DeliveredMessage() = default;
};

}  // namespace yomber
