#include "platform/xpc/left_out_method.h"

#include <utility>

namespace yomber {
namespace {

thread_local DeliveredMessage* innermostMessage = nullptr;

}  // namespace

DeliveredMessage::Frame::Frame(DeliveredMessage& message)
    : outer_(std::exchange(innermostMessage, &message)) {}

DeliveredMessage::Frame::~Frame() { innermostMessage = outer_; }

NSErrorRef NSXPCMethodIsLeftOut(const std::string& method) {
  const std::string text = "the object at the other end does not have \"" + method + "\"";
  if (innermostMessage != nullptr) innermostMessage->leaveOut(text);
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid,
                                  {{NSLocalizedDescriptionKey, text}});
}

}  // namespace yomber
