// What has to be there after the power was cut.
#include <algorithm>
#include <charconv>
#include <filesystem>

#include <SQLiteCpp/SQLiteCpp.h>
#include <gtest/gtest.h>

#include "tests/manifest/manifest_check.h"

namespace yomber::testing {

namespace fs = std::filesystem;

namespace {

using Kind = Reading::Kind;

/// The number of the document that a file of that name is; nothing for other files.
std::optional<int> numberOf(const std::string& name) {
  int number = 0;
  const char* const end = name.data() + name.size();
  if (!name.starts_with("d")) return std::nullopt;
  const auto [rest, failure] = std::from_chars(name.data() + 1, end, number);
  return failure == std::errc() && rest != end && *rest == '-' ? std::optional(number)
                                                               : std::nullopt;
}

/// Which of the contents that may be there after a cut these bytes are.
std::optional<Version> safeVersion(const Document& document, const std::string& bytes) {
  const std::size_t first = document.durable.value_or(0);
  for (std::size_t i = document.versions.size(); i-- > first;) {
    if (document.versions[i].size == bytes.size() && document.versions[i].bytes() == bytes) {
      return document.versions[i];
    }
  }
  return std::nullopt;
}

}  // namespace

bool isSoundDatabase(const std::string& path) {
  try {
    SQLite::Database database(path, SQLite::OPEN_READONLY, 10'000);
    const std::string answer = database.execAndGet("PRAGMA integrity_check").getString();
    EXPECT_EQ(answer, "ok") << path;
    return answer == "ok";
  } catch (const SQLite::Exception& failure) {
    ADD_FAILURE() << path << ": " << failure.what();
    return false;
  }
}

std::map<int, std::vector<std::string>> ManifestCheck::filesByNumber(LoadWorker& worker) const {
  std::vector<std::string> folders{trashFolder()};
  for (const LoadWorker::Folder& folder : worker.folders()) folders.push_back(folder.path);
  std::map<int, std::vector<std::string>> files;
  for (const std::string& folder : folders) {
    std::error_code failure;
    for (const auto& entry : fs::directory_iterator(folder, failure)) {
      const std::string path = entry.path();
      if (const auto number = numberOf(entry.path().filename())) files[*number].push_back(path);
    }
  }
  return files;
}

/// Of one document that has a file.
void ManifestCheck::look(Document& document, const std::vector<std::string>& files,
                         const std::string& boot) const {
  EXPECT_EQ(files.size(), 1U) << document.description() << " is doubled: " << files.back();
  const bool isInTrash = files.front().find("/.Trash/") != std::string::npos;
  document.isUncertain = false;
  document.isInTrash = isInTrash;
  document.mayBeGone = false;
  document.mayBeInTrash = false;
  document.mayBeAt.clear();
  document.path = files.front();
  if (!document.isIdSafe) document.id.clear();
  const Reading reading = readAt(document.path, boot);
  if (reading.kind != Kind::Content || document.isTorn) return;
  EXPECT_TRUE(safeVersion(document, reading.bytes))
      << document.description() << " can be read with " << reading.bytes.size() << " other bytes";
}

void ManifestCheck::nothingWrongSurvived(const std::string& boot) {
  for (const auto& worker : load_.workers()) {
    std::list<Document>& documents = worker->documents();
    auto files = filesByNumber(*worker);
    // Files aside that were to be renamed over a document.
    for (auto& [number, paths] : files) {
      std::erase_if(paths, [](const std::string& path) {
        return path.ends_with(".new") && fs::remove(path);
      });
    }
    std::erase_if(files, [](const auto& entry) { return entry.second.empty(); });
    for (auto document = documents.begin(); document != documents.end();) {
      const auto found = files.find(document->number);
      const bool isThere = found != files.end();
      EXPECT_TRUE(isThere || !document->durable) << document->description() << " was lost";
      // Never synced by who wrote it, nor confirmed: it may be anything.
      const bool isDropped =
          !isThere ||
          (!document->durable && readAt(found->second.front(), boot).kind == Kind::Content);
      if (isDropped && isThere) fs::remove(found->second.front());
      if (!isDropped) look(*document, found->second, boot);
      document = isDropped ? documents.erase(document) : std::next(document);
    }
  }
}

bool ManifestCheck::takeAsIs(LoadWorker& worker, Document& document) const {
  const ContentClient& zarn = *worker.zarn();
  if (document.isInTrash) {
    const auto back = worker.host()->untrash(document.id);
    EXPECT_EQ(back.error, nullptr) << document.description() << back.error->description();
    if (back.error) return false;
    document.path = zarn.locationOf(document.id);
    document.isInTrash = false;
  }
  // What was written, and not synced, over a document that was away may be found between holes: the
  // drive keeps it in a file beside it. Its user throws that away.
  const std::string beside = document.path.substr(0, document.path.rfind('.')) + " 2.bin";
  if (document.isTorn && fs::remove(beside)) (void)zarn.identifierAt(beside);
  const NSErrorRef error = zarn.provide(document.path);
  EXPECT_EQ(error, nullptr) << document.description() << ": " << error->description();
  const Reading reading = readAt(document.path, load_.options().power->boot);
  EXPECT_EQ(reading.kind, Kind::Content) << document.description() << " was provided";
  const auto version = safeVersion(document, reading.bytes);
  EXPECT_TRUE(version || document.isTorn)
      << document.description() << " was provided with " << reading.bytes.size() << " other bytes";
  if (version) {
    document.versions = {*version};
    document.becameDurable();
  } else {
    worker.rewrite(document);
  }
  return true;
}

void ManifestCheck::nothingSafeWasLost() {
  for (const auto& worker : load_.workers()) {
    for (Document& document : worker->documents()) (void)takeAsIs(*worker, document);
  }
}

}  // namespace yomber::testing
