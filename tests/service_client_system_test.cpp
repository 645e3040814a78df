// A program of somebody else, built against what is installed, speaks to an item's service.
#include <cstdlib>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/foundation/sanitized.h"
#include "platform/foundation/temporary_directory.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

class ServiceClient : public ::testing::Test {
 protected:
  void SetUp() override {
    if (kIsSanitized) {
      GTEST_SKIP() << "the installed libraries are built for a sanitizer, which programs of others "
                      "are not";
    }
    install();
    build();
  }

  void install() const {
    const ProcessResult result =
        runProcess({"/usr/bin/env", "cmake", "--install", std::getenv("YOMBER_BUILD_DIR"),
                    "--component", "client", "--prefix", installed_});
    ASSERT_EQ(result.exitCode, 0) << result.errors;
  }
  void build() const {
    const std::string command =
        "g++ -std=c++23 \"$YOMBER_SOURCE_DIR/docs/examples/sharing.cpp\" -o " + program_ +
        " $(pkg-config --cflags --libs yomber-client)";
    const ProcessResult result =
        runProcess({"/bin/sh", "-c", command}, {{"PKG_CONFIG_PATH", pkgConfigFolder()}});
    ASSERT_EQ(result.exitCode, 0) << result.errors;
  }
  [[nodiscard]] std::string pkgConfigFolder() const {
    const ProcessResult found = runProcess(
        {"/bin/sh", "-c", "dirname \"$(find " + installed_ + " -name yomber-client.pc)\""});
    return found.output.substr(0, found.output.find('\n'));
  }
  [[nodiscard]] ProcessResult run(const std::string& identifier) const {
    return runProcess({program_, identifier},
                      {{"YOMBER_HOME", drive_.home()}, {"XDG_RUNTIME_DIR", ""}});
  }

  const TemporaryDirectory directory_;
  const std::string installed_ = directory_ / "installed";
  const std::string program_ = directory_ / "sharing";
  TestDrive drive_;
};

TEST_F(ServiceClient, TheExampleShowsWhoHasAnItem) {
  drive_.write("report.txt", "text");
  drive_.up();
  ASSERT_TRUE(eventually([&] { return !drive_.names().empty(); }));
  const std::string identifier = drive_.json({"stat", "report.txt"}).front()["id"];
  EXPECT_EQ(run(identifier).output, "ada\nnot shared\n");
  ASSERT_EQ(drive_.yomber({"share", "link", "report.txt"}).exitCode, 0);
  EXPECT_THAT(run(identifier).output, StartsWith("ada\nyomber-share:"));
  const ProcessResult unknown = run("d:1");
  EXPECT_EQ(unknown.exitCode, 1);
  EXPECT_THAT(unknown.errors, HasSubstr("sharing: "));
  drive_.down();
  EXPECT_EQ(run(identifier).exitCode, 1) << "nobody answers";
}

}  // namespace
}  // namespace yomber::testing
