// The life of documents in a whole drive: in, up to the store, away, and back again.
#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <thread>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
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

constexpr std::size_t kKept = 4096;
constexpr std::uint64_t kLargestFault = 8192;

/// Everything about a file that has to survive.
struct Look {
  std::string content;
  std::map<std::string, std::string> attributes;  ///< those of the user's
  ino_t inode = 0;
  mode_t mode = 0;
  std::int64_t modified = 0;  ///< ns
  std::int64_t created = 0;   ///< ns

  friend bool operator==(const Look&, const Look&) = default;
};

std::map<std::string, std::string> attributesOf(const std::string& path) {
  std::map<std::string, std::string> result;
  std::array<char, 4096> names{};
  const ssize_t length = llistxattr(path.c_str(), names.data(), names.size());
  for (std::string_view rest(names.data(), static_cast<std::size_t>(std::max<ssize_t>(length, 0)));
       !rest.empty();) {
    const std::string name(rest.substr(0, rest.find('\0')));
    rest.remove_prefix(name.size() + 1);
    std::array<char, 65536> value{};
    const ssize_t size = lgetxattr(path.c_str(), name.c_str(), value.data(), value.size());
    const bool isOurs = name.starts_with("user.yomber.");
    if (size >= 0 && !isOurs) result[name].assign(value.data(), static_cast<std::size_t>(size));
  }
  return result;
}

Look lookAt(const std::string& path) {
  struct statx status{};
  EXPECT_EQ(statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_ALL, &status), 0) << path;
  return {.content = contentOf(path),
          .attributes = attributesOf(path),
          .inode = status.stx_ino,
          .mode = status.stx_mode,
          .modified = status.stx_mtime.tv_sec * 1'000'000'000 + status.stx_mtime.tv_nsec,
          .created = status.stx_btime.tv_sec * 1'000'000'000 + status.stx_btime.tv_nsec};
}

/// What a client may be told while others want the content, or want it gone.
void expectMayBeSaid(const NSErrorRef& error) {
  const bool mayBe = !error || error->is(NSPOSIXErrorDomain, EBUSY) ||
                     error->is(NSCocoaErrorDomain, NSUserCancelledError) ||
                     error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict);
  EXPECT_TRUE(mayBe) << error->description();
}

class ContentSystem : public ::testing::Test {
 protected:
  void SetUp() override {
    drive_.up();
    client_.emplace(drive_.home());
  }
  [[nodiscard]] std::string at(const std::string& path) const { return drive_.root() + "/" + path; }
  [[nodiscard]] std::string idOf(const std::string& argument) const {
    return drive_.json({"id", argument}).at(0).at("id");
  }
  /// A file outside of the drive.
  [[nodiscard]] std::string outside(const std::string& name, const std::string& content) const {
    std::string path = fs::path(drive_.home()).parent_path() / name;
    std::ofstream(path, std::ios::binary) << content;
    return path;
  }
  bool isConfirmed(const std::string& path) {
    return eventually([&] { return client_->state(path).upload == Upload::CONFIRMED; });
  }
  /// A document that the store has and this disk has not.
  void makeFault(const std::string& name, const std::string& content) {
    drive_.write(name, content);
    ASSERT_TRUE(isConfirmed(at(name))) << name;
    const NSErrorRef error = client_->evict(at(name));
    ASSERT_EQ(error, nullptr) << error->description();
    ASSERT_TRUE(eventually([&] { return client_->state(at(name)).local == Local::FAULT; }));
  }

  TestDrive drive_;
  std::optional<ContentClient> client_;
};

TEST_F(ContentSystem, ADocumentGoesAndComesBackAsItWas) {
  const std::string source = outside("report.bin", someContent(300'000, 1));
  ASSERT_EQ(chmod(source.c_str(), 0640), 0);
  ASSERT_EQ(setxattr(source.c_str(), "user.comment", "mine", 4, 0), 0);
  fs::last_write_time(source, fs::file_time_type::clock::now() - std::chrono::hours(1000));

  const auto put = drive_.json({"put", source});
  ASSERT_EQ(put.size(), 1U);
  const std::string id = put[0]["id"];
  const std::string path = at("report.bin");
  ASSERT_EQ(drive_.yomber({"tag", "report.bin", "work", "two words"}).exitCode, 0);
  ASSERT_EQ(drive_.yomber({"favorite", "report.bin", "3"}).exitCode, 0);
  ASSERT_TRUE(isConfirmed(path));
  const Look before = lookAt(path);
  EXPECT_EQ(before.content, someContent(300'000, 1));
  EXPECT_EQ(before.attributes.at("user.comment"), "mine");
  EXPECT_EQ(before.attributes.at("user.xdg.tags"), "work,two words");

  ASSERT_EQ(drive_.yomber({"evict", "report.bin"}).exitCode, 0);
  EXPECT_LE(bytesOnDisk(path), kLargestFault);
  EXPECT_EQ(client_->state(path).local, Local::FAULT);
  Look away = lookAt(path);
  EXPECT_EQ(away.content.substr(0, kKept), before.content.substr(0, kKept));
  away.content = before.content;
  EXPECT_EQ(away, before);
  const auto item = drive_.json({"stat", id}).at(0);
  EXPECT_EQ(item["downloaded"], false);
  EXPECT_EQ(item["uploaded"], true);
  EXPECT_EQ(item["size"], 300'000);

  ASSERT_EQ(drive_.yomber({"provide", "report.bin"}).exitCode, 0);
  EXPECT_EQ(lookAt(path), before);
  const auto back = drive_.json({"stat", id}).at(0);
  EXPECT_EQ(back["downloaded"], true);
  EXPECT_EQ(back["tags"], nlohmann::json({"work", "two words"}));
  EXPECT_EQ(back["favorite_rank"], 3);
}

TEST_F(ContentSystem, AnEmptyAndATinyDocumentKeepAllTheyHave) {
  for (const std::size_t size : {std::size_t{0}, std::size_t{1}, kKept}) {
    const std::string name = "size" + std::to_string(size);
    drive_.write(name, someContent(size, 2));
    ASSERT_TRUE(isConfirmed(at(name)));
    const Look before = lookAt(at(name));
    EXPECT_EQ(client_->evict(at(name)), nullptr);
    EXPECT_LE(bytesOnDisk(at(name)), kLargestFault);
    EXPECT_EQ(client_->provide(at(name)), nullptr);
    EXPECT_EQ(lookAt(at(name)), before);
  }
}

TEST_F(ContentSystem, MarksOnADocumentThatIsAwayAreKept) {
  makeFault("x", someContent(50'000, 3));
  ASSERT_EQ(client_->setTagNames(at("x"), {"later"}), nullptr);
  EXPECT_EQ(client_->state(at("x")).local, Local::FAULT);
  EXPECT_EQ(client_->provide(at("x")), nullptr);
  EXPECT_EQ(contentOf(at("x")), someContent(50'000, 3));
  EXPECT_EQ(attributesOf(at("x")).at("user.xdg.tags"), "later");
  // Marks are no change of the content: it can go again.
  ASSERT_EQ(client_->setTagNames(at("x"), {"later", "still"}), nullptr);
  ASSERT_TRUE(isConfirmed(at("x")));
  const NSErrorRef error = client_->evict(at("x"));
  EXPECT_EQ(error, nullptr) << error->description();
}

TEST_F(ContentSystem, ADocumentThatIsAwayGoesToTheTrashAndBack) {
  makeFault("x", someContent(50'000, 4));
  const std::string id = idOf("x");
  const auto trashed = client_->trash(at("x"));
  ASSERT_EQ(trashed.error, nullptr);
  EXPECT_EQ(client_->state(trashed.path).local, Local::FAULT);
  EXPECT_LE(bytesOnDisk(trashed.path), kLargestFault);
  ASSERT_EQ(drive_.json({"untrash", "x"}).size(), 1U);
  EXPECT_EQ(idOf("x"), id);
  EXPECT_EQ(client_->provide(at("x")), nullptr);
  EXPECT_EQ(contentOf(at("x")), someContent(50'000, 4));
}

TEST_F(ContentSystem, ADocumentThatIsAwayIsRenamedAndMovedAsItIs) {
  drive_.makeFolder("folder");
  makeFault("x", someContent(50'000, 5));
  const std::string id = idOf("x");
  ASSERT_EQ(drive_.yomber({"rename", "x", "y"}).exitCode, 0);
  ASSERT_EQ(drive_.yomber({"mv", "y", "folder"}).exitCode, 0);
  EXPECT_EQ(idOf("folder/y"), id);
  EXPECT_EQ(client_->state(at("folder/y")).local, Local::FAULT);
  EXPECT_EQ(client_->provide(at("folder/y")), nullptr);
  EXPECT_EQ(contentOf(at("folder/y")), someContent(50'000, 5));
}

TEST_F(ContentSystem, WhatIsNotConfirmedOrWasChangedDoesNotGo) {
  drive_.makeFolder("folder");
  NSErrorRef error = client_->evict(at("folder"));
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict)) << error->description();
  drive_.write("x", someContent(50'000, 6));
  ASSERT_TRUE(isConfirmed(at("x")));
  const int open = ::open(at("x").c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_GE(open, 0);
  error = client_->evict(at("x"));
  close(open);
  ASSERT_NE(error, nullptr);
  EXPECT_TRUE(error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict)) << error->description();
  EXPECT_EQ(contentOf(at("x")), someContent(50'000, 6));
}

TEST_F(ContentSystem, TenClientsAtOnceSeeOnlyTheContent) {
  const std::string content = someContent(400'000, 7);
  makeFault("x", content);
  constexpr int kClients = 10;
  constexpr int kRounds = 20;
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int number = 0; number < kClients; ++number) {
    threads.emplace_back([&, number] {
      const ContentClient client(drive_.home());
      for (int round = 0; round < kRounds; ++round) {
        switch ((number + round) % 4) {
          case 0:
            client.provideAndForget(at("x"));
            break;
          case 1:
            (void)client.evict(at("x"));
            break;
          default:
            // Another client's eviction may win; what was said to be there and is read under a
            // descriptor, which keeps it there, has to be right.
            const int file = ::open(at("x").c_str(), O_RDONLY | O_CLOEXEC);
            const NSErrorRef error = client.provide(at("x"));
            std::string found(content.size(), '\0');
            const ssize_t length = pread(file, found.data(), found.size(), 0);
            const bool isRight = length == static_cast<ssize_t>(content.size()) && found == content;
            close(file);
            if (!error && !isRight) ++wrong;
        }
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
  EXPECT_EQ(client_->provide(at("x")), nullptr);
  EXPECT_EQ(contentOf(at("x")), content);
}

class ContentCrowd : public ContentSystem {
 protected:
  static constexpr int kClients = 10;

  /// All of them do one thing each, at once. False when one was left unanswered.
  bool actAtOnce(const std::function<void(int number)>& act) {
    std::atomic<int> ended{0};
    std::vector<std::thread> threads;
    for (int number = 0; number < kClients; ++number) {
      threads.emplace_back([&, number] {
        act(number);
        ++ended;
      });
    }
    const bool areAnswered = eventually([&] { return ended == kClients; });
    EXPECT_TRUE(areAnswered) << kClients - ended << " clients wait for an answer";
    if (!areAnswered) drive_.crash();  // with which the calls end
    for (auto& thread : threads) thread.join();
    return areAnswered;
  }
  /// Asks the host for the content, and reads it while the host keeps it.
  void provideAndRead(const HostClient& host) {
    // Under a descriptor, with which zarn does not give it up either.
    const int file = ::open(at("x").c_str(), O_RDONLY | O_CLOEXEC);
    HostClient::Need need;
    const NSErrorRef error = host.provide(at("x"), need);
    std::string found(content_.size(), '\0');
    const ssize_t length = pread(file, found.data(), found.size(), 0);
    close(file);
    expectMayBeSaid(error);
    if (error) return;
    EXPECT_TRUE(length == static_cast<ssize_t>(content_.size()) && found == content_);
    ++served_;
  }

  const std::string content_ = someContent(400'000, 9);
  std::atomic<int> served_{0};
};

TEST_F(ContentCrowd, TenClientsOfTheHostAndOfZarnAreAllAnsweredAndSeeOnlyTheContent) {
  makeFault("x", content_);
  std::vector<std::unique_ptr<HostClient>> hosts;
  std::vector<std::unique_ptr<ContentClient>> zarns;
  for (int number = 0; number < kClients; ++number) {
    hosts.push_back(std::make_unique<HostClient>(drive_.home()));
    zarns.push_back(std::make_unique<ContentClient>(drive_.home()));
  }
  for (int round = 0; round < 30; ++round) {
    // Also that nobody's wish was left: it can go.
    ASSERT_TRUE(eventually([&] { return client_->evict(at("x")) == nullptr; })) << round;
    const bool isForgotten = round % 2 == 0;  // in every second round, all wishes are taken back
    ASSERT_TRUE(actAtOnce([&](int number) {
      const HostClient& host = *hosts[static_cast<std::size_t>(number)];
      const ContentClient& zarn = *zarns[static_cast<std::size_t>(number)];
      switch ((number + round) % 5) {
        case 0:
          return expectMayBeSaid(host.stopProviding(at("x")));
        case 1:
          return expectMayBeSaid(zarn.evict(at("x")));
        case 2:
          return host.provideAndForget(at("x"));
        default:
          return isForgotten ? host.provideAndForget(at("x")) : provideAndRead(host);
      }
    })) << round;
  }
  EXPECT_GT(served_, 0);
  ASSERT_TRUE(eventually([&] { return client_->evict(at("x")) == nullptr; }));
  EXPECT_EQ(client_->state(at("x")).local, Local::FAULT);
  HostClient::Need need;
  EXPECT_EQ(hosts.front()->provide(at("x"), need), nullptr);
  EXPECT_EQ(contentOf(at("x")), content_);
}

TEST_F(ContentSystem, ADocumentThatIsAwaySurvivesARestart) {
  makeFault("x", someContent(50'000, 8));
  const std::string id = idOf("x");
  drive_.kill(TestDrive::Process::Zarn);
  ASSERT_TRUE(eventually([&] {
    try {
      client_.emplace(drive_.home());
      return client_->identifierAt(at("x")) == id;
    } catch (const std::exception&) {
      return false;
    }
  }));
  EXPECT_EQ(client_->state(at("x")).local, Local::FAULT);
  EXPECT_EQ(client_->provide(at("x")), nullptr);
  EXPECT_EQ(contentOf(at("x")), someContent(50'000, 8));
}

}  // namespace
}  // namespace yomber::testing
