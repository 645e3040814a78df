#pragma once

#include <map>
#include <string>
#include <vector>

#include "platform/foundation/property_value.h"

namespace yomber {

// What an application says about itself that decides which part of the drive is its own: keys of
// its
// `.desktop` file, as LSBundleProxy answers them.

/// Its own identifier: a string.
inline constexpr const char* QSApplicationIdentifierEntitlement = "application-identifier";
/// The services of the drive that it uses: a list. "Documents" asks for a container named after the
/// application.
inline constexpr const char* QSYomberServicesEntitlement = "X-Yomber-Services";
inline constexpr const char* QSYomberServiceDocuments = "Documents";
/// The containers that it uses, its own first: a list.
inline constexpr const char* QSYomberContainerIdentifiersEntitlement = "X-Yomber-Containers";
/// Containers that it shares with other applications of its maker: a list.
inline constexpr const char* QSUbiquityContainerIdentifiersEntitlement =
    "X-Yomber-Shared-Containers";

/// The identifiers of the containers that an application with these entitlements may use, each
/// once. The order of preference:
///
///   1. the list of QSYomberContainerIdentifiersEntitlement, in its order;
///   2. the list of QSUbiquityContainerIdentifiersEntitlement, in its order;
///   3. the application's own identifier, when its services have "Documents".
///
/// An identifier alone entitles to nothing, since every application has one. Values of another type
/// than is said above count as absent, but one string stands for a list of one.
/// Thread-safety: a pure function.
[[nodiscard]] std::vector<std::string> QSEntitledContainerIdentifiers(
    const std::map<std::string, NSPropertyValue>& entitlements);

}  // namespace yomber
