#include "platform/ostrell/entitlements.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace yomber {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using Strings = std::vector<std::string>;

TEST(Entitlements, OwnContainersComeBeforeSharedOnesAndTheApplicationsName) {
  EXPECT_THAT(QSEntitledContainerIdentifiers(
                  {{QSApplicationIdentifierEntitlement, std::string("org.example.App")},
                   {QSYomberServicesEntitlement, Strings{"Documents"}},
                   {QSUbiquityContainerIdentifiersEntitlement, Strings{"org.z", "org.b"}},
                   {QSYomberContainerIdentifiersEntitlement, Strings{"org.b", "org.a"}}}),
              ElementsAre("org.b", "org.a", "org.z", "org.example.App"));
}

TEST(Entitlements, AnIdentifierAloneEntitlesToNothing) {
  EXPECT_THAT(QSEntitledContainerIdentifiers(
                  {{QSApplicationIdentifierEntitlement, std::string("org.example.App")}}),
              IsEmpty());
  EXPECT_THAT(QSEntitledContainerIdentifiers(
                  {{QSApplicationIdentifierEntitlement, std::string("org.example.App")},
                   {QSYomberServicesEntitlement, Strings{"Sharing"}}}),
              IsEmpty());
  EXPECT_THAT(QSEntitledContainerIdentifiers({}), IsEmpty());
}

TEST(Entitlements, TheDocumentsServiceEntitlesToAContainerOfTheApplicationsName) {
  EXPECT_THAT(QSEntitledContainerIdentifiers(
                  {{QSApplicationIdentifierEntitlement, std::string("org.example.App")},
                   {QSYomberServicesEntitlement, std::string("Documents")}}),
              ElementsAre("org.example.App"));
}

TEST(Entitlements, ValuesOfAnotherTypeAndEmptyNamesCountAsAbsent) {
  EXPECT_THAT(QSEntitledContainerIdentifiers(
                  {{QSYomberContainerIdentifiersEntitlement, true},
                   {QSUbiquityContainerIdentifiersEntitlement, Strings{"", "org.a"}},
                   {QSApplicationIdentifierEntitlement, std::int64_t{4}},
                   {QSYomberServicesEntitlement, Strings{"Documents"}}}),
              ElementsAre("org.a"));
}

}  // namespace
}  // namespace yomber
