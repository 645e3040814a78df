#include "tests/manifest/manifest_check.h"

#include <algorithm>
#include <filesystem>
#include <set>

#include <SQLiteCpp/SQLiteCpp.h>
#include <gtest/gtest.h>

#include "tests/harness/child_process.h"

namespace yomber::testing {

namespace fs = std::filesystem;

namespace {

using Kind = Reading::Kind;
using Upload = ContentClient::Upload;

bool isAtPlace(const std::string& path) {
  std::error_code failure;
  return !path.empty() && fs::exists(fs::symlink_status(path, failure));
}

void isNowCertain(Document& document, const std::string& path, bool isInTrash) {
  document.path = path;
  document.isInTrash = isInTrash;
  document.isUncertain = false;
  document.mayBeAt.clear();
  document.mayBeGone = false;
  document.mayBeInTrash = false;
}

enum class Outcome { Certain, Gone, Unknown };

/// What came of a call about a document that was not answered.
Outcome outcomeOf(const ContentClient& zarn, Document& document) {
  // Both places are looked at before the drive is asked where it is.
  const std::string here = zarn.identifierAt(document.path);
  if (!document.mayBeAt.empty()) (void)zarn.identifierAt(document.mayBeAt);
  const bool isHere = isAtPlace(document.path);
  const bool isThere = isAtPlace(document.mayBeAt);
  if (isHere && isThere) return Outcome::Unknown;
  if (isHere || isThere) {
    isNowCertain(document, isHere ? document.path : document.mayBeAt, false);
    return Outcome::Certain;
  }
  const std::string now = document.id.empty() ? here : zarn.locationOf(document.id);
  const bool mayBeInTrash = document.mayBeInTrash || document.isInTrash;
  if (mayBeInTrash && now.find("/.Trash/") != std::string::npos) {
    isNowCertain(document, document.path, true);
    return Outcome::Certain;
  }
  return document.mayBeGone && now.empty() ? Outcome::Gone : Outcome::Unknown;
}

/// Where the document is said to be.
std::string locationOf(const ContentClient& zarn, const Document& document) {
  return document.isInTrash ? zarn.locationOf(document.id) : document.path;
}

void expectContentAt(const std::string& path, const Document& document, const std::string& boot) {
  const Reading reading = readAt(path, boot);
  EXPECT_NE(reading.kind, Kind::Nothing) << document.description() << " is not there";
  if (reading.kind != Kind::Content) return;
  EXPECT_TRUE(reading.bytes == document.content().bytes())
      << document.description() << " can be read with " << reading.bytes.size()
      << " bytes that are not its " << document.content().size << " bytes";
}

}  // namespace

std::optional<std::int64_t> jobsInDatabase(const std::string& home) {
  try {
    SQLite::Database database(home + "/zarn.db", SQLite::OPEN_READONLY, 1000);
    return database.execAndGet("SELECT count(*) FROM job").getInt64();
  } catch (const SQLite::Exception&) {
    return std::nullopt;
  }
}

std::string ManifestCheck::trashFolder() const {
  return load_.options().home + "/tree/.Trash/files";
}

void ManifestCheck::nothingWrongCanBeRead() const {
  for (const auto& worker : load_.workers()) {
    for (const Document& document : worker->documents()) {
      if (document.isUncertain || document.isInTrash) continue;
      expectContentAt(document.path, document, load_.options().power->boot);
    }
  }
}

bool ManifestCheck::isUp(LoadWorker& worker) const {
  if (worker.zarn() == nullptr || worker.host() == nullptr) return false;
  return worker.host()->list(worker.folders().front().id).has_value();
}

bool ManifestCheck::resolve(LoadWorker& worker, std::string& reason) const {
  for (auto document = worker.documents().begin(); document != worker.documents().end();) {
    const Outcome outcome =
        document->isUncertain ? outcomeOf(*worker.zarn(), *document) : Outcome::Certain;
    if (outcome == Outcome::Unknown) {
      reason = "it is not known what became of " + document->description();
      return false;
    }
    document = outcome == Outcome::Gone ? worker.documents().erase(document) : std::next(document);
  }
  return true;
}

bool ManifestCheck::isSettled(LoadWorker& worker, std::string& reason) const {
  const ContentClient& zarn = *worker.zarn();
  for (Document& document : worker.documents()) {
    if (!document.isInTrash || document.id.empty()) {
      const std::string id = zarn.identifierAt(document.path);
      if (document.id.empty()) document.id = id;
      reason = document.description() + " is known as \"" + id + "\"";
      if (id.empty() || id != document.id) return false;
    }
    const auto state = zarn.state(locationOf(zarn, document));
    reason = document.description() + " is not confirmed";
    for (const NSErrorRef& error : {state.error, state.lastFailure}) {
      if (error) reason += ": " + error->description();
    }
    if (state.error || state.upload != Upload::CONFIRMED) return false;
  }
  const auto jobs = jobsInDatabase(load_.options().home);
  reason = "jobs are left: " + std::to_string(jobs.value_or(-1));
  return jobs == 0;
}

bool ManifestCheck::settles() {
  std::string reason;
  const auto isDone = [&](LoadWorker& worker) {
    try {
      reason = "the drive is not up";
      if (isUp(worker) && resolve(worker, reason) && isSettled(worker, reason)) return true;
    } catch (const std::exception& failure) {
      reason = failure.what();
    }
    if (reason == "the drive is not up") worker.forgetConnections();
    return false;
  };
  for (const auto& worker : load_.workers()) worker->forgetConnections();
  const bool isSettledNow = eventually([&] {
    return std::ranges::all_of(load_.workers(),
                               [&](const auto& worker) { return isDone(*worker); });
  });
  EXPECT_TRUE(isSettledNow) << reason;
  return isSettledNow;
}

void ManifestCheck::everythingIsSafe() {
  for (const auto& worker : load_.workers()) {
    for (Document& document : worker->documents()) {
      document.becameDurable();
      document.isIdSafe = true;
    }
  }
}

void ManifestCheck::everythingIsThere() const {
  std::set<std::string> ids;
  for (const auto& worker : load_.workers()) {
    const ContentClient& zarn = *worker->zarn();
    for (const Document& document : worker->documents()) {
      EXPECT_TRUE(ids.insert(document.id).second) << document.id << " is two documents";
      const std::string location = zarn.locationOf(document.id);
      if (document.isInTrash) {
        EXPECT_NE(location.find("/.Trash/"), std::string::npos)
            << document.description() << location;
      } else {
        EXPECT_EQ(location, document.path) << document.description();
      }
      expectContentAt(location, document, load_.options().power->boot);
    }
    expectFolders(*worker);
  }
  expectTrash();
}

void ManifestCheck::expectTrash() const {
  std::set<std::string> names;
  for (const auto& worker : load_.workers()) {
    for (const Document& document : worker->documents()) {
      if (document.isInTrash) names.insert(nameOf(worker->zarn()->locationOf(document.id)));
    }
  }
  std::set<std::string> onDisk;
  for (const auto& entry : fs::directory_iterator(trashFolder())) {
    onDisk.insert(entry.path().filename());
  }
  EXPECT_EQ(onDisk, names) << "in the trash";
}

void ManifestCheck::expectFolders(LoadWorker& worker) const {
  for (const LoadWorker::Folder& folder : worker.folders()) {
    std::vector<std::string> ids;
    std::set<std::string> names;
    for (const Document& document : worker.documents()) {
      if (document.isInTrash || folderOf(document.path) != folder.path) continue;
      ids.push_back(document.id);
      names.insert(nameOf(document.path));
    }
    std::set<std::string> onDisk;
    for (const auto& entry : fs::directory_iterator(folder.path)) {
      onDisk.insert(entry.path().filename());
    }
    EXPECT_EQ(onDisk, names) << folder.path;
    std::vector<std::string> listed =
        worker.host()->list(folder.id).value_or(std::vector<std::string>{"it cannot be listed"});
    std::ranges::sort(ids);
    std::ranges::sort(listed);
    EXPECT_EQ(listed, ids) << folder.path;
  }
}

void ManifestCheck::expectProvided(LoadWorker& worker, const Document& document) const {
  const NSErrorRef error = worker.zarn()->provide(document.path);
  EXPECT_EQ(error, nullptr) << document.description() << ": " << error->description();
  const Reading reading = readAt(document.path, load_.options().power->boot);
  EXPECT_EQ(reading.kind, Kind::Content) << document.description() << " was provided";
  expectContentAt(document.path, document, load_.options().power->boot);
}

void ManifestCheck::someCanBeProvided(std::size_t count) const {
  for (const auto& worker : load_.workers()) {
    std::size_t left = count;
    for (const Document& document : worker->documents()) {
      const bool isAway = !document.isInTrash &&
                          readAt(document.path, load_.options().power->boot).kind == Kind::Away;
      if (!isAway || left == 0) continue;
      --left;
      expectProvided(*worker, document);
    }
  }
}

void ManifestCheck::allGoAndComeBack() const {
  for (const auto& worker : load_.workers()) {
    for (const Document& document : worker->documents()) {
      if (document.isInTrash) continue;
      const NSErrorRef error = worker->zarn()->evict(document.path);
      EXPECT_EQ(error, nullptr) << document.description() << ": " << error->description();
      EXPECT_EQ(readAt(document.path, load_.options().power->boot).kind, Kind::Away)
          << document.description();
    }
    for (const Document& document : worker->documents()) {
      if (!document.isInTrash) expectProvided(*worker, document);
    }
  }
}

}  // namespace yomber::testing
