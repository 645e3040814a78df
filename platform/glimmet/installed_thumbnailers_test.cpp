#include "platform/glimmet/installed_thumbnailers.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "platform/foundation/temporary_directory.h"

namespace yomber {
namespace {

namespace fs = std::filesystem;

class InstalledThumbnailersTest : public testing::Test {
 protected:
  void SetUp() override {
    fs::create_directories(own_);
    fs::create_directories(machine_);
    write(aliases_, "image/x-bmp image/bmp\n");
  }

  static void write(const std::string& path, const std::string& text) {
    std::ofstream(path + ".new") << text;
    fs::rename(path + ".new", path);
  }

  static std::string entry(const std::string& types, const std::string& program = "/bin/sh") {
    return "# drawn by hand\n[Thumbnailer Entry]\nTryExec=" + program +
           "\nExec=draw %i %o\nMimeType=" + types + "\n";
  }

  TemporaryDirectory directory_;
  const std::string own_ = directory_ / "own";
  const std::string machine_ = directory_ / "machine";
  const std::string aliases_ = directory_ / "aliases";
  InstalledThumbnailers thumbnailers_{{own_, machine_, directory_ / "missing"}, aliases_};
};

TEST_F(InstalledThumbnailersTest, NothingIsDrawnWhereNoneIsInstalled) {
  EXPECT_FALSE(thumbnailers_.canDraw("image/png"));
  EXPECT_FALSE(thumbnailers_.canDraw(""));
}

TEST_F(InstalledThumbnailersTest, TheTypesOfAnInstalledOneAreDrawnAndNoOthers) {
  write(machine_ + "/a.thumbnailer", entry("image/png; video/mp4;"));
  EXPECT_TRUE(thumbnailers_.canDraw("image/png"));
  EXPECT_TRUE(thumbnailers_.canDraw("video/mp4"));
  EXPECT_TRUE(thumbnailers_.canDraw("VIDEO/MP4"));
  EXPECT_FALSE(thumbnailers_.canDraw("video/webm"));
}

TEST_F(InstalledThumbnailersTest, AnotherNameOfATypeIsTheSameType) {
  write(machine_ + "/a.thumbnailer", entry("image/x-bmp"));
  EXPECT_TRUE(thumbnailers_.canDraw("image/bmp"));
  EXPECT_TRUE(thumbnailers_.canDraw("image/x-bmp"));
}

TEST_F(InstalledThumbnailersTest, WhatIsInstalledAndRemovedLaterIsSeen) {
  EXPECT_FALSE(thumbnailers_.canDraw("image/png"));
  write(own_ + "/a.thumbnailer", entry("image/png"));
  EXPECT_TRUE(thumbnailers_.canDraw("image/png"));
  write(own_ + "/a.thumbnailer", entry("image/gif"));
  EXPECT_FALSE(thumbnailers_.canDraw("image/png"));
  EXPECT_TRUE(thumbnailers_.canDraw("image/gif"));
  fs::remove(own_ + "/a.thumbnailer");
  EXPECT_FALSE(thumbnailers_.canDraw("image/gif"));
}

TEST_F(InstalledThumbnailersTest, TheUsersFileStandsInForTheMachinesOfThatName) {
  write(machine_ + "/a.thumbnailer", entry("image/png"));
  write(own_ + "/a.thumbnailer", entry("image/gif"));
  EXPECT_TRUE(thumbnailers_.canDraw("image/gif"));
  EXPECT_FALSE(thumbnailers_.canDraw("image/png"));
}

TEST_F(InstalledThumbnailersTest, AProgramThatIsNotThereDrawsNothingUntilItIs) {
  const std::string program = directory_ / "draw";
  write(machine_ + "/a.thumbnailer", entry("image/png", program));
  EXPECT_FALSE(thumbnailers_.canDraw("image/png"));
  write(program, "#!/bin/sh\n");
  EXPECT_FALSE(thumbnailers_.canDraw("image/png")) << "not executable";
  ASSERT_EQ(chmod(program.c_str(), 0755), 0);
  EXPECT_TRUE(thumbnailers_.canDraw("image/png"));
}

TEST_F(InstalledThumbnailersTest, RubbishAndOtherFilesAreNoThumbnailers) {
  write(machine_ + "/a.thumbnailer", std::string("\0[x\n=\n[Thumbnailer Entry", 24));
  write(machine_ + "/b.thumbnailer", "[Thumbnailer Entry]\nMimeType=image/png\n");
  write(machine_ + "/c.txt", entry("image/png"));
  fs::create_directory(machine_ + "/d.thumbnailer");
  ASSERT_EQ(mkfifo((machine_ + "/e.thumbnailer").c_str(), 0600), 0);
  EXPECT_FALSE(thumbnailers_.canDraw("image/png"));
}

TEST_F(InstalledThumbnailersTest, ACommandIsSplitAsAShellWould) {
  const auto commandOf = [&](const std::string& exec) {
    write(machine_ + "/films.thumbnailer",
          "[Thumbnailer Entry]\nExec=" + exec + "\nMimeType=video/mp4;\n");
    return thumbnailers_.commandFor("video/mp4");
  };
  using Words = std::vector<std::string>;
  EXPECT_EQ(commandOf("film -i %i  -o %o\t-s %s"),
            (Words{"film", "-i", "%i", "-o", "%o", "-s", "%s"}));
  EXPECT_EQ(commandOf(R"("my film" 'a "b" \c' d\ e "f\"g" "")"),
            (Words{"my film", R"(a "b" \c)", "d e", "f\"g", ""}));
  EXPECT_EQ(commandOf("film 'without an end"), Words());
  EXPECT_FALSE(thumbnailers_.canDraw("video/mp4"));
  EXPECT_EQ(thumbnailers_.commandFor("video/webm"), Words());
}

TEST_F(InstalledThumbnailersTest, TheFirstWhoseProgramIsThereCounts) {
  write(own_ + "/a.thumbnailer", entry("video/mp4;", "/nowhere/film"));
  write(machine_ + "/b.thumbnailer",
        "[Thumbnailer Entry]\nTryExec=/bin/sh\nExec=film %o\nMimeType=video/mp4;\n");
  EXPECT_EQ(thumbnailers_.commandFor("video/mp4"), (std::vector<std::string>{"film", "%o"}));
}

TEST_F(InstalledThumbnailersTest, TheVersionsDifferWhenAFileWasReplaced) {
  write(machine_ + "/a.thumbnailer", entry("image/png"));
  const std::string before = thumbnailers_.versions();
  EXPECT_EQ(thumbnailers_.versions(), before);
  write(machine_ + "/a.thumbnailer", entry("image/png", "/bin/true"));
  EXPECT_NE(thumbnailers_.versions(), before);
}

TEST_F(InstalledThumbnailersTest, TheTypesAreThoseOfProgramsThatAreThere) {
  EXPECT_EQ(thumbnailers_.types(), std::vector<std::string>());
  write(own_ + "/a.thumbnailer", entry("video/webm;", "/nowhere/film"));
  write(machine_ + "/b.thumbnailer", entry("video/mp4;audio/flac;", "/bin/sh"));
  EXPECT_EQ(thumbnailers_.types(), (std::vector<std::string>{"audio/flac", "video/mp4"}));
}

}  // namespace
}  // namespace yomber
