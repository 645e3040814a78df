// Programs that people use, on the drive as on any folder.
#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "tests/harness/file_contents.h"
#include "tests/harness/mount_fixture.h"

namespace yomber::testing {
namespace {

namespace fs = std::filesystem;

class MountApplications : public MountFixture {
 protected:
  void SetUp() override { fs::create_directory(outside("")); }

  /// Beside the drive, on the disk.
  [[nodiscard]] std::string outside(const std::string& name) {
    return fs::path(mounted_.drive().home()).parent_path() / "outside" / name;
  }
  /// The first of these programs that is missing; empty: none is.
  static std::string missing(const std::vector<std::string>& programs) {
    for (const std::string& program : programs) {
      if (runProcess({"/bin/sh", "-c", "command -v " + program}).exitCode != 0) return program;
    }
    return "";
  }
  /// Runs a script that ends with its first failure; $DRIVE and $OUTSIDE are the folders.
  std::string run(const std::string& script) {
    Environment environment = mounted_.drive().environment();
    environment["DRIVE"] = mounted_.folder();
    environment["OUTSIDE"] = outside("");
    environment["LC_ALL"] = "C.UTF-8";
    const ProcessResult result =
        runProcess({"/bin/sh", "-euc", script}, environment, std::chrono::minutes(3));
    EXPECT_EQ(result.exitCode, 0) << result.output << result.errors;
    return result.output;
  }
};

TEST_F(MountApplications, ARepositoryIsClonedBuiltChangedAndPushedBack) {
  const std::string lacking = missing({"git", "make", "cc"});
  if (!lacking.empty()) GTEST_SKIP() << "there is no " << lacking;
  const std::string printed = run(R"sh(
    export GIT_CONFIG_GLOBAL=/dev/null GIT_CONFIG_SYSTEM=/dev/null GIT_AUTHOR_NAME=Ada \
      GIT_AUTHOR_EMAIL=ada@example.org GIT_COMMITTER_NAME=Ada GIT_COMMITTER_EMAIL=ada@example.org
    git init -q -b main "$OUTSIDE/source"
    cd "$OUTSIDE/source"
    printf 'objects := $(patsubst %%.c,%%.o,$(wildcard *.c))\nsum: $(objects)\n\tcc -o $@ $^\n%%.o: %%.c\n\tcc -c -o $@ $<\nclean:\n\trm -f *.o sum\n' > Makefile
    printf '*.o\nsum\n' > .gitignore
    body='' declared=''
    for i in $(seq 1 20); do
      printf 'int part%d(void) { return %d; }\n' $i $i > part$i.c
      body="$body + part$i()" declared="$declared int part$i(void);"
      printf '#include <stdio.h>\n%s\nint main(void) { printf("%%d\\n", 0%s); }\n' \
        "$declared" "$body" > main.c
      git add . && git commit -q -m "Part $i"
    done
    git tag first && git config receive.denyCurrentBranch updateInstead
    git clone -q "$OUTSIDE/source" "$DRIVE/clone"
    cd "$DRIVE/clone"
    git fsck --full --strict
    test "$(git log --oneline | wc -l)" = 20
    make -s -j2 && ./sum && make -s clean && make -s && ./sum
    test -z "$(git status --porcelain)"
    git checkout -q -b change && git mv part1.c one.c && printf '\n' >> one.c
    git commit -q -a -m 'Rename a part' && git checkout -q main && git merge -q --no-ff -m merge change
    git gc -q --prune=now && git fsck --full --strict
    git push -q origin main
    test "$(git -C "$OUTSIDE/source" rev-parse HEAD)" = "$(git rev-parse HEAD)"
    diff -r --exclude=.git --exclude='*.o' --exclude=sum "$OUTSIDE/source" "$DRIVE/clone"
  )sh");
  EXPECT_EQ(printed, "210\n210\n");
}

TEST_F(MountApplications, ADatabaseWhoseWritersAreKilledKeepsWhatWasCommitted) {
  const std::string lacking = missing({"python3"});
  if (!lacking.empty()) GTEST_SKIP() << "there is no " << lacking;
  std::ofstream(outside("writer.py")) << R"sh(
import sqlite3, sys
database = sqlite3.connect(sys.argv[1], timeout=15)
database.execute("PRAGMA journal_mode=" + sys.argv[2])
database.execute("CREATE TABLE IF NOT EXISTS entry(number INTEGER PRIMARY KEY, text TEXT)")
database.execute("CREATE INDEX IF NOT EXISTS by_text ON entry(text)")
database.commit()
while True:
    with database:
        for i in range(20):
            database.execute("INSERT INTO entry(text) VALUES(hex(randomblob(300)))")
        database.execute("UPDATE entry SET text=hex(randomblob(200)) WHERE number % 7 = abs(random()) % 7")
    print(database.execute("SELECT max(number) FROM entry").fetchone()[0], flush=True)
)sh";
  std::ofstream(outside("check.py")) << R"sh(
import sqlite3, sys
database = sqlite3.connect(sys.argv[1], timeout=60)
print(database.execute("PRAGMA integrity_check").fetchone()[0],
      database.execute("SELECT count(*) FROM entry").fetchone()[0])
)sh";
  for (const std::string mode : {"delete", "wal", "truncate"}) {
    const std::string database = at("of mode " + mode + ".db");
    for (int kills = 0; kills < 4; ++kills) {
      long committed = 0;
      {
        // Two that get in each other's way, killed wherever they are. Who waits for the lock looks
        // only now and then, so that one of them may never get it.
        const std::vector<std::string> command{"/usr/bin/python3", outside("writer.py"), database,
                                               mode};
        LineProcess writer(command);
        LineProcess other(command);
        int lines = 0;
        const auto isEnough = [&](const std::string& line) {
          committed = std::max(committed, std::stol(line));
          return ++lines == 5 + kills;
        };
        const bool isBusy = writer.readUntil(isEnough) || other.readUntil(isEnough);
        EXPECT_TRUE(isBusy) << mode;
      }
      const ProcessResult checked = runProcess({"/usr/bin/python3", outside("check.py"), database});
      ASSERT_EQ(checked.exitCode, 0) << checked.errors;
      EXPECT_TRUE(checked.output.starts_with("ok ")) << mode << ": " << checked.output;
      EXPECT_GE(std::stol(checked.output.substr(3)), committed) << mode;
    }
  }
}

TEST_F(MountApplications, ATreeThatIsCopiedThereAndBackIsTheSame) {
  const std::string lacking = missing({"rsync"});
  if (!lacking.empty()) GTEST_SKIP() << "there is no " << lacking;
  const std::string printed = run(R"sh(
    mkdir -p "$OUTSIDE/tree/empty" "$OUTSIDE/tree/a/deep/er one"
    cd "$OUTSIDE/tree"
    for i in $(seq 1 50); do head -c $((i * 700)) /dev/urandom > "a/file $i"; done
    ln -s ../a/deep link && ln -s /nowhere/at/all broken && mkfifo pipe
    head -c 5000000 /dev/urandom > a/large && truncate -s 300000 a/zeros
    printf x > 'a/deep/er one/Zürich – 東京' && printf x > .hidden && : > nothing
    chmod 0640 a/large && chmod 0750 a && chmod 0400 'a/file 3' && chmod 1777 empty
    touch -d '1999-12-31 23:59:59.123456789' 'a/file 4' && touch -d '2001-01-01' a/deep
    rsync -a "$OUTSIDE/tree/" "$DRIVE/tree/"
    rsync -a -n -c -i --delete "$OUTSIDE/tree/" "$DRIVE/tree/"
    rsync -a -n -i "$DRIVE/tree/" "$OUTSIDE/tree/"
    rsync -a "$DRIVE/tree/" "$OUTSIDE/back/"
    rsync -a -n -c -i --delete "$OUTSIDE/tree/" "$OUTSIDE/back/"
    # In place and by pieces, of what is there already; not skipped as of the same second.
    printf changed | dd of=a/large bs=1 seek=1000000 conv=notrunc status=none
    rsync -a -I --no-whole-file --inplace "$OUTSIDE/tree/" "$DRIVE/tree/"
    rsync -a -n -c -i --delete "$OUTSIDE/tree/" "$DRIVE/tree/"
  )sh");
  EXPECT_EQ(printed, "");
}

TEST_F(MountApplications, AnArchiveOfWhatIsAwayHasTheOriginals) {
  fs::create_directories(at("tree/below"));
  fs::create_directories(outside("tree/below"));
  for (const char* const name : {"tree/small", "tree/below/large", "tree/below/larger"}) {
    const std::string content = someContent(std::string(name).size() * 40'000, 3);
    std::ofstream(outside(name), std::ios::binary) << content;
    makeAway(name, content);
  }
  // 1: it says that the files have changed, since what brings content changes the status' date.
  run(R"sh(
    mkdir "$OUTSIDE/sparse"
    tar -C "$DRIVE" -S -cf "$OUTSIDE/sparse.tar" tree || test $? = 1
    tar -C "$OUTSIDE/sparse" -xf "$OUTSIDE/sparse.tar"
    diff -r "$OUTSIDE/tree" "$OUTSIDE/sparse/tree"
  )sh");
  ASSERT_EQ(mounted_.drive().yomber({"evict", "tree"}).exitCode, 0);
  ASSERT_TRUE(isAway("tree/below/large"));
  run(R"sh(
    mkdir "$OUTSIDE/plain"
    { tar -C "$DRIVE" -cf - tree || test $? = 1; } | tar -C "$OUTSIDE/plain" -xf -
    diff -r "$OUTSIDE/tree" "$OUTSIDE/plain/tree"
  )sh");
}

TEST_F(MountApplications, WhatIsAwayIsMappedSharedAndRun) {
  const std::string program = contentOf("/bin/true");
  ASSERT_GT(program.size(), 4096U);
  makeAway("true", program);
  ASSERT_EQ(chmod(at("true").c_str(), 0755), 0);
  ASSERT_TRUE(isAway("true"));
  EXPECT_EQ(runProcess({at("true")}).exitCode, 0);
  EXPECT_FALSE(isAway("true"));

  std::string content = someContent(100'000, 4);
  makeAway("report", content);
  {
    const OpenedFile file(at("report"), O_RDWR);
    void* const map =
        mmap(nullptr, content.size(), PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
    ASSERT_NE(map, MAP_FAILED);
    auto* const bytes = static_cast<char*>(map);
    EXPECT_TRUE(std::string(bytes, content.size()) == content);
    bytes[50'000] = static_cast<char>(~bytes[50'000]);
    content[50'000] = bytes[50'000];
    EXPECT_EQ(msync(map, content.size(), MS_SYNC), 0);
    munmap(map, content.size());
  }
  EXPECT_TRUE(contentOf(onDisk("report")) == content);
  // The store has what was written that way.
  evict("report");
  EXPECT_TRUE(contentOf(at("report")) == content);
}

TEST_F(MountApplications, AnEditorsSaveKeepsTheDocument) {
  const std::string editor = missing({"vim.basic"}).empty() ? "vim.basic" : "vim.tiny";
  if (!missing({editor}).empty()) GTEST_SKIP() << "there is no vim";
  std::ofstream(at("report.txt")) << "nothing yet\n";
  ASSERT_TRUE(isConfirmed("report.txt"));
  const std::string id = client_.identifierAt(onDisk("report.txt"));
  std::string expected = "nothing yet\n";
  // Renames it to the backup, copies it there, keeps none, keeps it.
  for (const std::string settings : {"backupcopy=no writebackup", "backupcopy=yes writebackup",
                                     "nowritebackup", "backupcopy=no backup"}) {
    run("cd \"$DRIVE\" && " + editor + " -u NONE -N -es -c 'set swapfile " + settings +
        "' -c 'normal Gosaved' -c wq report.txt");
    expected += "saved\n";
    EXPECT_EQ(contentOf(at("report.txt")), expected) << settings;
    ASSERT_TRUE(isConfirmed("report.txt")) << settings;
    EXPECT_EQ(client_.identifierAt(onDisk("report.txt")), id) << settings;
  }
  EXPECT_FALSE(fs::exists(at(".report.txt.swp")));
}

}  // namespace
}  // namespace yomber::testing
