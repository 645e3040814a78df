#include "platform/ostrell/url_resource_values.h"

#include "platform/ostrell/errors.h"
#include "platform/ostrell/query_item.h"
#include "platform/ostrell/url_additions.h"
#include "protocols/common.capnp.h"

namespace yomber {
namespace {

QSQueryItemRef itemAt(const NSURLRef& url, NSErrorRef* error) {
  return QSQueryItem::askDaemonQueryItemForURL(url, ForceScan::No, error);
}

}  // namespace

bool getResourceValue(const NSURLRef& url, std::optional<bool>& value, const std::string& forKey,
                      NSErrorRef* error) {
  if (!url) return false;
  const bool isAliasKey = forKey == NSURLIsAliasFileKey;
  if (!isAliasKey && forKey != NSURLUbiquitousItemIsSharedKey) {
    storeError(error, qsc_errorInvalidParameter("key", forKey));
    return false;
  }
  const auto item = itemAt(url, error);
  if (!item) return false;
  value = isAliasKey ? item->fields().kind == ItemKind::Bookmark
                     : (item->fields().flags & protocol::ITEM_FLAG_SHARED) != 0;
  return true;
}

bool getPromisedItemResourceValue(const NSURLRef& url, std::optional<bool>& value,
                                  const std::string& forKey, NSErrorRef* error) {
  // A link in the tree says itself whether it is a bookmark; a promised item has no file.
  if (url && forKey == NSURLIsAliasFileKey && url->resourceValues()) {
    value = qs_isExternalDocumentReference(url);
    return true;
  }
  return getResourceValue(url, value, forKey, error);
}

std::optional<std::string> qs_typeIdentifierWithError(const NSURLRef& url, NSErrorRef* error) {
  if (!url) return std::nullopt;
  const auto item = itemAt(url, error);
  return item ? std::optional(item->fields().contentType) : std::nullopt;
}

}  // namespace yomber
