#include "platform/ostrell/entitlements.h"

#include <algorithm>
#include <variant>

namespace yomber {
namespace {

std::vector<std::string> stringsOf(const std::map<std::string, NSPropertyValue>& entitlements,
                                   const char* key) {
  const auto found = entitlements.find(key);
  if (found == entitlements.end()) return {};
  if (const auto* list = std::get_if<std::vector<std::string>>(&found->second)) return *list;
  if (const auto* string = std::get_if<std::string>(&found->second)) return {*string};
  return {};
}

}  // namespace

std::vector<std::string> QSEntitledContainerIdentifiers(
    const std::map<std::string, NSPropertyValue>& entitlements) {
  std::vector<std::string> identifiers;
  const auto add = [&identifiers](const std::vector<std::string>& more) {
    for (const auto& each : more) {
      const bool isKnown = std::ranges::find(identifiers, each) != identifiers.end();
      if (!each.empty() && !isKnown) identifiers.push_back(each);
    }
  };
  add(stringsOf(entitlements, QSYomberContainerIdentifiersEntitlement));
  add(stringsOf(entitlements, QSUbiquityContainerIdentifiersEntitlement));
  const auto services = stringsOf(entitlements, QSYomberServicesEntitlement);
  if (std::ranges::find(services, QSYomberServiceDocuments) != services.end()) {
    add(stringsOf(entitlements, QSApplicationIdentifierEntitlement));
  }
  return identifiers;
}

}  // namespace yomber
