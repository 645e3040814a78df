// Documents in a whole drive: saved by editors, moved between applications' folders, and kept apart
// by account.
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/ostrell/constants.h"
#include "tests/harness/content_client.h"
#include "tests/harness/file_contents.h"
#include "tests/harness/host_client.h"
#include "tests/harness/test_drive.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;
using Local = ContentClient::Local;
using Upload = ContentClient::Upload;

/// Written as editors do: made anew, or emptied, then written and synced.
void writeFile(const std::string& path, const std::string& content, int flags) {
  const int file = open(path.c_str(), O_WRONLY | O_CLOEXEC | flags, 0644);
  ASSERT_GE(file, 0) << path;
  EXPECT_EQ(write(file, content.data(), content.size()), static_cast<ssize_t>(content.size()));
  EXPECT_EQ(fsync(file), 0);
  close(file);
}

void move(const std::string& from, const std::string& to) {
  ASSERT_EQ(rename(from.c_str(), to.c_str()), 0) << from;
}

struct Editor {
  const char* name;
  std::function<void(const std::string& folder, const std::string& document,
                     const std::string& content)>
      save;
};

/// What they do to the disk when a document is saved.
const std::vector<Editor>& editors() {
  static const std::vector<Editor> all{
      {"vim",
       [](const auto& folder, const auto& document, const auto& content) {
         writeFile(folder + "/." + fs::path(document).filename().string() + ".swp", "swap",
                   O_CREAT);
         writeFile(folder + "/4913", "", O_CREAT | O_EXCL);
         fs::remove(folder + "/4913");
         move(document, document + "~");
         writeFile(document, content, O_CREAT | O_TRUNC);
         fs::permissions(document, fs::perms(0644));
         fs::remove(document + "~");
         fs::remove(folder + "/." + fs::path(document).filename().string() + ".swp");
       }},
      {"vim, which copies to the backup",
       [](const auto&, const auto& document, const auto& content) {
         fs::copy_file(document, document + "~");
         writeFile(document, content, O_TRUNC);
         fs::remove(document + "~");
       }},
      {"gedit",
       [](const auto& folder, const auto& document, const auto& content) {
         const std::string made = folder + "/.goutputstream-X1Y2Z3";
         writeFile(made, content, O_CREAT | O_EXCL);
         move(made, document);
       }},
      {"gedit, which keeps a backup",
       [](const auto& folder, const auto& document, const auto& content) {
         const std::string made = folder + "/.goutputstream-X4Y5Z6";
         writeFile(made, content, O_CREAT | O_EXCL);
         fs::remove(document + "~");
         ASSERT_EQ(link(document.c_str(), (document + "~").c_str()), 0);
         move(made, document);
         fs::remove(document + "~");
       }},
      {"LibreOffice",
       [](const auto& folder, const auto& document, const auto& content) {
         const std::string lock =
             folder + "/.~lock." + fs::path(document).filename().string() + "#";
         writeFile(lock, "ada", O_CREAT);
         const std::string made = folder + "/lu1234abcd.tmp";
         writeFile(made, content, O_CREAT | O_EXCL);
         move(made, document);
         fs::remove(lock);
       }},
      {"LibreOffice, which writes in place",
       [](const auto& folder, const auto& document, const auto& content) {
         const std::string lock =
             folder + "/.~lock." + fs::path(document).filename().string() + "#";
         writeFile(lock, "ada", O_CREAT);
         writeFile(document, content, 0);
         ASSERT_EQ(truncate(document.c_str(), static_cast<off_t>(content.size())), 0);
         fs::remove(lock);
       }},
      {"mv",
       [](const auto& folder, const auto& document, const auto& content) {
         writeFile(folder + "/.new.nosync", content, O_CREAT | O_EXCL);
         move(folder + "/.new.nosync", document);
       }},
  };
  return all;
}

class DocumentsSystem : public ::testing::Test {
 protected:
  void up() {
    drive_.up();
    client_.emplace(drive_.home());
  }
  /// An application with a folder of its own in the drive; answers where that is.
  [[nodiscard]] std::string installNotes() const {
    std::ofstream(fs::path(drive_.home()).parent_path() / "data/applications" /
                  "org.example.Notes.desktop")
        << "[Desktop Entry]\nType=Application\nExec=true\nName=Notes\n"
           "X-Yomber-Container=org.example.Notes\n";
    return drive_.home() + "/tree/org.example.Notes/Documents";
  }
  [[nodiscard]] std::string at(const std::string& name) const { return drive_.root() + "/" + name; }
  bool isConfirmed(const std::string& path) {
    return eventually([&] { return client_->state(path).upload == Upload::CONFIRMED; });
  }
  void makeFault(const std::string& name, const std::string& content) {
    drive_.write(name, content);
    ASSERT_TRUE(isConfirmed(at(name))) << name;
    const NSErrorRef error = client_->evict(at(name));
    ASSERT_EQ(error, nullptr) << error->description();
  }

  TestDrive drive_;
  std::optional<ContentClient> client_;
};

TEST_F(DocumentsSystem, ADocumentThatAnEditorSavesKeepsItsID) {
  up();
  for (const Editor& editor : editors()) {
    SCOPED_TRACE(editor.name);
    drive_.makeFolder(editor.name);
    const std::string folder = at(editor.name);
    const std::string document = folder + "/report.odt";
    writeFile(document, someContent(20'000, 1), O_CREAT);
    ASSERT_TRUE(isConfirmed(document));
    const std::string id = client_->identifierAt(document);
    for (std::uint32_t save = 2; save < 4; ++save) {
      const std::string content = someContent(20'000 + save, save);
      editor.save(folder, document, content);
      ASSERT_TRUE(eventually([&] {
        const auto state = client_->state(document);
        return state.upload == Upload::CONFIRMED && state.size == content.size();
      }));
      EXPECT_EQ(client_->identifierAt(document), id);
      EXPECT_TRUE(contentOf(document) == content);
    }
    EXPECT_EQ(drive_.names(editor.name), std::vector<std::string>{"report.odt"});
    // What the store has is what was saved last.
    ASSERT_EQ(client_->evict(document), nullptr);
    ASSERT_EQ(client_->provide(document), nullptr);
    EXPECT_TRUE(contentOf(document) == someContent(20'003, 3));
  }
}

TEST_F(DocumentsSystem, WhatIsAwayMovesBetweenApplicationsFoldersAndComesThere) {
  const std::string notes = installNotes();
  up();
  ASSERT_TRUE(eventually([&] { return fs::exists(notes); }));
  drive_.makeFolder("folder");
  makeFault("x", someContent(60'000, 1));
  makeFault("folder/y", someContent(70'000, 2));
  makeFault("z", someContent(80'000, 3));
  const std::string x = client_->identifierAt(at("x"));
  const std::string y = client_->identifierAt(at("folder/y"));
  const std::string z = client_->identifierAt(at("z"));
  for (const char* item : {"x", "folder"}) {
    const auto moved = drive_.yomber({"mv", item, notes});
    ASSERT_EQ(moved.exitCode, 0) << moved.errors;
  }
  // By another program, around the drive.
  move(at("z"), notes + "/z");
  ASSERT_TRUE(eventually([&] { return client_->locationOf(z) == notes + "/z"; }));
  const struct {
    std::string id;
    std::string path;
    std::string content;
  } all[] = {{x, notes + "/x", someContent(60'000, 1)},
             {y, notes + "/folder/y", someContent(70'000, 2)},
             {z, notes + "/z", someContent(80'000, 3)}};
  for (const auto& each : all) {
    SCOPED_TRACE(each.path);
    EXPECT_EQ(client_->identifierAt(each.path), each.id);
    ASSERT_EQ(client_->provide(each.path), nullptr);
    EXPECT_TRUE(contentOf(each.path) == each.content);
    // The store has it where it is now.
    ASSERT_TRUE(isConfirmed(each.path));
    ASSERT_EQ(client_->evict(each.path), nullptr);
    ASSERT_EQ(client_->provide(each.path), nullptr);
    EXPECT_TRUE(contentOf(each.path) == each.content);
  }
}

TEST_F(DocumentsSystem, WhatIsBroughtHereToBeMovedIsNotStopped) {
  const std::string notes = installNotes();
  const std::string gate = fs::path(drive_.home()).parent_path() / "gate";
  drive_.environment()["YOMBER_FAULTS"] = "zarn.fill.begun=pause-until-file:" + gate;
  up();
  ASSERT_TRUE(eventually([&] { return fs::exists(notes); }));
  const std::string content = someContent(60'000, 6);
  makeFault("x", content);
  const std::string id = client_->identifierAt(at("x"));
  ProcessResult moved;
  std::thread mover([&] { moved = drive_.yomber({"mv", "x", notes}); });
  EXPECT_TRUE(eventually([&] { return fs::exists(gate + ".reached"); }));
  const HostClient host(drive_.home());
  EXPECT_EQ(host.stopProviding(at("x")), nullptr);
  const std::string refused =
      "[WARNING] Can't cancel download of " + at("x") + " which is downloading for CZM";
  EXPECT_TRUE(eventually([&] {
    return drive_.yomber({"log", "--lines", "500"}).output.find(refused) != std::string::npos;
  }));
  EXPECT_EQ(client_->state(at("x")).local, Local::DOWNLOADING);
  EXPECT_FALSE(fs::exists(notes + "/x"));
  std::ofstream(gate).put('x');
  mover.join();
  EXPECT_EQ(moved.exitCode, 0) << moved.errors;
  EXPECT_EQ(client_->identifierAt(notes + "/x"), id);
  EXPECT_EQ(client_->state(notes + "/x").local, Local::HERE);
  EXPECT_TRUE(contentOf(notes + "/x") == content);
}

TEST_F(DocumentsSystem, ACopyOfWhatIsAwayIsAnItemOfItsOwn) {
  up();
  const std::string content = someContent(90'000, 4);
  makeFault("x", content);
  ASSERT_EQ(std::system(("cp -a '" + at("x") + "' '" + at("copy") + "'").c_str()), 0);
  ASSERT_TRUE(isConfirmed(at("copy")));
  EXPECT_NE(client_->identifierAt(at("copy")), client_->identifierAt(at("x")));
  EXPECT_EQ(client_->state(at("copy")).local, Local::FAULT);
  ASSERT_EQ(drive_.yomber({"rm", "x"}).exitCode, 0);
  ASSERT_EQ(client_->provide(at("copy")), nullptr);
  EXPECT_TRUE(contentOf(at("copy")) == content);
}

TEST_F(DocumentsSystem, AnotherAccountGetsNothingOfTheFirst) {
  up();
  const std::string content = someContent(90'000, 5);
  makeFault("x", content);
  ASSERT_EQ(drive_.yomber({"account", "sign-out"}).exitCode, 0);
  ASSERT_EQ(drive_.yomber({"account", "sign-in", "bob"}).exitCode, 0);
  const auto provided = drive_.yomber({"provide", "x"});
  EXPECT_NE(provided.exitCode, 0);
  EXPECT_NE(provided.errors.find("ada"), std::string::npos) << provided.errors;
  EXPECT_EQ(client_->state(at("x")).local, Local::FAULT);
  drive_.write("of bob", "text");
  ASSERT_TRUE(isConfirmed(at("of bob")));
  ASSERT_EQ(drive_.yomber({"account", "sign-out"}).exitCode, 0);
  ASSERT_EQ(drive_.yomber({"account", "sign-in", "ada"}).exitCode, 0);
  EXPECT_EQ(drive_.yomber({"provide", "x"}).exitCode, 0);
  EXPECT_TRUE(contentOf(at("x")) == content);
}

}  // namespace
}  // namespace yomber::testing
