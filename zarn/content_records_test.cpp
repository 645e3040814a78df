#include "zarn/content_records.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <string>

#include "platform/ostrell/constants.h"
#include "zarn/test_daemon.h"

namespace yomber::test {
namespace {

using testing::IsEmpty;

class ContentRecordsTest : public DaemonTest {
 protected:
  struct Object {
    Wire::ObjectKind kind = Wire::ObjectKind::DOCUMENT;
    std::uint64_t id = 0;
  };
  /// "record in zone (owner)", by the object's id.
  std::map<std::uint64_t, std::string> recordsOf(const std::vector<Object>& objects,
                                                 NSErrorRef* error = nullptr) {
    std::map<std::uint64_t, std::string> found;
    call(
        &Wire::Client::contentRecordsRequest,
        [&](auto params) {
          auto list = params.initObjects(static_cast<unsigned>(objects.size()));
          for (unsigned i = 0; i < objects.size(); ++i) {
            list[i].setKind(objects[i].kind);
            list[i].setRawID(objects[i].id);
          }
        },
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isError()) return storeError(error, ipc::decodeError(result.getError()));
          const auto zones = result.getFound().getZones();
          for (const auto each : result.getFound().getRecords()) {
            const auto zone = zones[each.getZone()];
            found[each.getObject().getRawID()] = stringFromWire(each.getRecord()) + " in " +
                                                 stringFromWire(zone.getName()) + " (" +
                                                 stringFromWire(zone.getOwner()) + ")";
          }
        });
    return found;
  }
  std::uint64_t idOf(const std::string& name) {
    const auto item = itemAt(root_ + "/" + name, true);
    EXPECT_TRUE(item) << name;
    return item ? item->rawID : 0;
  }
  /// Until the store has the content.
  bool waitForRecord(std::uint64_t id) {
    const auto deadline = steady_clock::now() + std::chrono::seconds(60);
    while (recordsOf({{.id = id}}).empty()) {
      if (steady_clock::now() > deadline) return false;
      (void)drive_->engine->waitUntilIdle(std::chrono::seconds(1));
    }
    return true;
  }
};

TEST_F(ContentRecordsTest, ADocumentsRecordIsNamedOnceTheStoreHasItsContent) {
  write("a.txt");
  write("folder/b.txt", "b");
  fs::create_symlink("a.txt", root_ + "/link");
  upSignedIn();
  const std::uint64_t a = idOf("a.txt");
  const std::uint64_t b = idOf("folder/b.txt");
  ASSERT_TRUE(waitForRecord(a));
  ASSERT_TRUE(waitForRecord(b));
  const auto found = recordsOf({{.id = a},
                                {.id = b},
                                {.id = idOf("link")},
                                {.kind = Wire::ObjectKind::FOLDER, .id = idOf("folder")},
                                {.id = idOf("folder")},
                                {.id = 0},
                                {.id = 1},
                                {.id = 987'654'321}});
  const std::string zone = std::string(" in ") + QSUbiquitousDefaultContainerID;
  const std::map<std::uint64_t, std::string> expected{
      {a, std::to_string(a) + zone + " (__currentUser__)"},
      {b, std::to_string(b) + zone + " (__currentUser__)"}};
  EXPECT_EQ(found, expected);
}

TEST_F(ContentRecordsTest, AnotherAccountSeesNoRecordsAndNobodyIsRefused) {
  write("a.txt");
  upSignedIn();
  const std::uint64_t a = idOf("a.txt");
  ASSERT_TRUE(waitForRecord(a));
  ASSERT_EQ(signOut(), nullptr);
  NSErrorRef error;
  EXPECT_THAT(recordsOf({{.id = a}}, &error), IsEmpty());
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut));
  ASSERT_EQ(signIn("grace"), nullptr);
  EXPECT_THAT(recordsOf({{.id = a}}), IsEmpty());
}

TEST_F(ContentRecordsTest, TooManyObjectsAreRefused) {
  upSignedIn();
  NSErrorRef error;
  EXPECT_THAT(recordsOf(std::vector<Object>(ContentRecords::kMaximumObjects + 1), &error),
              IsEmpty());
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorInvalidParameter));
}

}  // namespace
}  // namespace yomber::test
