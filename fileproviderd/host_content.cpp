#include "fileproviderd/host.h"

namespace yomber {

ExtensionContent& Host::content() {
  if (content_ == nullptr) {
    content_ = std::make_shared<ExtensionContent>(
        *supervisor_, [weak = weak_from_this()](const NSErrorRef& error,
                                                std::function<void(NSErrorRef)> handler) {
          const auto self = weak.lock();
          if (self == nullptr) return handler(error);
          self->explain(error, std::move(handler));
        });
  }
  return *content_;
}

ContentNeeds& Host::contentNeeds() {
  if (needs_ == nullptr) needs_ = ContentNeeds::create(content(), options_.needs);
  return *needs_;
}

}  // namespace yomber
