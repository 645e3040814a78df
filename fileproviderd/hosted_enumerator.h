#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/data.h"
#include "platform/foundation/error.h"

namespace yomber {

/// A page of a listing, or why there is none.
struct PageAnswer {
  std::vector<ItemFields> items;
  NSDataRef next;  ///< nil: the listing is complete
  NSErrorRef error;
};

/// Changes since an anchor, or why there are none.
struct ChangesAnswer {
  std::vector<ItemFields> updated;
  std::vector<std::string> deleted;
  NSDataRef anchor;
  bool moreComing = false;
  NSErrorRef error;
};

struct AnchorAnswer {
  NSDataRef anchor;  ///< nil without an error: the enumerator tells no changes
  NSErrorRef error;
};

/// An enumerator of the extension, as the host holds it. Destroying it invalidates the enumerator;
/// answers that are under way may still come.
///
/// Each handler is called once, never before the call returns. Errors are the extension's own or,
/// when it cannot be reached, connection errors.
/// Thread-safety: loop thread only.
class HostedEnumerator {
 public:
  virtual ~HostedEnumerator() = default;
  /// `page` is one that this enumerator gave, or nil for the beginning.
  virtual void items(const NSDataRef& page, std::function<void(PageAnswer)> handler) = 0;
  virtual void changes(const NSDataRef& anchor, std::function<void(ChangesAnswer)> handler) = 0;
  virtual void currentAnchor(std::function<void(AnchorAnswer)> handler) = 0;
};

using HostedEnumeratorRef = std::shared_ptr<HostedEnumerator>;
using EnumeratorHandler = std::function<void(HostedEnumeratorRef enumerator, NSErrorRef error)>;

/// Where watches get their enumerators. Thread-safety: loop thread only.
class EnumeratorSource {
 public:
  virtual ~EnumeratorSource() = default;
  /// Starts the extension when there is none. Answers within a bounded time.
  virtual void enumerator(const std::string& container, EnumeratorHandler handler) = 0;
  /// Answers true only when the daemon itself says that there is no such folder.
  virtual void isGone(const std::string& container, std::function<void(bool)> handler) = 0;
};

}  // namespace yomber
