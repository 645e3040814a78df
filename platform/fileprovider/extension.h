#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/enumerator.h"
#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"
#include "platform/foundation/url.h"

namespace yomber {

using ErrorHandler = std::function<void(NSErrorRef error)>;
using ItemHandler = std::function<void(NSFileProviderItemRef item, NSErrorRef error)>;
using MoveHandler = std::function<void(bool requiresProviding, NSErrorRef error)>;

/// The base class of a file-provider extension. The host calls these operations concurrently, on
/// threads of its own choosing; each has the framework's default answer, so that an extension
/// overrides just what it does.
///
/// Synchronous operations may block their thread. Handlers may be empty; those given are called
/// exactly once, on any thread. The default answer of an asynchronous operation is
/// NSFeatureUnsupportedError.
class NSFileProviderExtension {
 public:
  NSFileProviderExtension();
  virtual ~NSFileProviderExtension();
  NSFileProviderExtension(const NSFileProviderExtension&) = delete;
  NSFileProviderExtension& operator=(const NSFileProviderExtension&) = delete;

  // Lookups and enumeration.
  virtual NSURLRef URLForItemWithPersistentIdentifier(
      const NSFileProviderItemIdentifier& identifier);
  virtual std::optional<NSFileProviderItemIdentifier> persistentIdentifierForItemAtURL(
      const NSURLRef& url);
  virtual NSFileProviderItemRef itemForIdentifier(const NSFileProviderItemIdentifier& identifier,
                                                  NSErrorRef* error = nullptr);
  virtual NSFileProviderEnumeratorRef enumeratorForContainerItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error = nullptr);

  // Content.
  virtual void providePlaceholderAtURL(const NSURLRef& url, ErrorHandler completionHandler);
  virtual void startProvidingItemAtURL(const NSURLRef& url, ErrorHandler completionHandler);
  virtual void stopProvidingItemAtURL(const NSURLRef& url);
  virtual void itemChangedAtURL(const NSURLRef& url);
};

}  // namespace yomber
