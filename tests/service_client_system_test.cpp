// Programs of somebody else, built against what is installed, speak to an item's services.
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
  }

  void install() const {
    const ProcessResult result =
        runProcess({"/usr/bin/env", "cmake", "--install", std::getenv("YOMBER_BUILD_DIR"),
                    "--component", "client", "--prefix", installed_});
    ASSERT_EQ(result.exitCode, 0) << result.errors;
  }
  /// Builds an example of the documentation as its readers do.
  void build(const std::string& example) const {
    const std::string command = "g++ -std=c++23 \"$YOMBER_SOURCE_DIR/docs/examples/" + example +
                                ".cpp\" -o " + program(example) +
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
  [[nodiscard]] ProcessResult run(const std::string& example, const std::string& identifier) const {
    return runProcess({program(example), identifier},
                      {{"YOMBER_HOME", drive_.home()}, {"XDG_RUNTIME_DIR", ""}});
  }
  [[nodiscard]] std::string program(const std::string& example) const {
    return directory_ / example;
  }
  /// The drive comes up with the document; its identifier.
  std::string upWith(const std::string& document) {
    drive_.write(document, "text");
    drive_.up();
    EXPECT_TRUE(eventually([&] { return !drive_.names().empty(); }));
    return drive_.json({"stat", document}).front()["id"];
  }

  const TemporaryDirectory directory_;
  const std::string installed_ = directory_ / "installed";
  TestDrive drive_;
};

TEST_F(ServiceClient, TheExampleShowsWhoHasAnItem) {
  build("sharing");
  const std::string identifier = upWith("report.txt");
  EXPECT_EQ(run("sharing", identifier).output, "ada\nnot shared\n");
  ASSERT_EQ(drive_.yomber({"share", "link", "report.txt"}).exitCode, 0);
  EXPECT_THAT(run("sharing", identifier).output, StartsWith("ada\nyomber-share:"));
  const ProcessResult unknown = run("sharing", "d:1");
  EXPECT_EQ(unknown.exitCode, 1);
  EXPECT_THAT(unknown.errors, HasSubstr("sharing: "));
  drive_.down();
  EXPECT_EQ(run("sharing", identifier).exitCode, 1) << "nobody answers";
}

TEST_F(ServiceClient, TheExampleAsksForWhatEditingTogetherTakes) {
  build("collaboration");
  const std::string identifier = upWith("report.txt");
  const ProcessResult unshared = run("collaboration", identifier);
  EXPECT_EQ(unshared.output, "version 1, capabilities 82\n");
  EXPECT_EQ(unshared.exitCode, 1);
  EXPECT_THAT(unshared.errors, HasSubstr("not shared"));
  ASSERT_EQ(drive_.yomber({"share", "link", "report.txt"}).exitCode, 0);
  nlohmann::json token;
  // The share has none to begin with until its document is uploaded.
  ASSERT_TRUE(eventually([&] {
    token = drive_.json({"collab", "token", "report.txt"}).front();
    return !token.at("base_token").get<std::string>().empty();
  }));
  EXPECT_EQ(run("collaboration", identifier).output,
            "version 1, capabilities 82\ncom.kelvo.Ostrell\n" +
                token.at("share_token").get<std::string>() + "\n" +
                token.at("base_token").get<std::string>() + "\n");
}

TEST_F(ServiceClient, TheInstalledSchemasCompileWithoutOurSources) {
  const std::string command = "cd \"$(dirname \"$(find " + installed_ +
                              " -name services.capnp)\")\" && mkdir " + (directory_ / "compiled") +
                              " && capnp compile -oc++:" + (directory_ / "compiled") +
                              " *.capnp && ls " + (directory_ / "compiled");
  const ProcessResult compiled = runProcess({"/bin/sh", "-c", command});
  EXPECT_EQ(compiled.exitCode, 0) << compiled.errors;
  for (const char* const schema : {"common", "control", "services", "sharing"})
    EXPECT_THAT(compiled.output, HasSubstr(std::string(schema) + ".capnp.h\n"));
}

}  // namespace
}  // namespace yomber::testing
