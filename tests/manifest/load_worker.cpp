#include "tests/manifest/load_worker.h"

#include <cerrno>
#include <cstdio>
#include <exception>
#include <filesystem>
#include <fstream>

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "platform/fileprovider/constants.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/ostrell/constants.h"

namespace yomber::testing {

namespace {

constexpr std::array<const char*, 3> kFolderNames{"inbox", "plans", "old"};

bool writeAll(int file, const std::string& bytes) {
  for (std::size_t done = 0; done < bytes.size();) {
    const std::size_t length = std::min<std::size_t>(bytes.size() - done, 32768);
    const ssize_t written = pwrite(file, bytes.data() + done, length, static_cast<off_t>(done));
    if (written <= 0) return false;
    done += static_cast<std::size_t>(written);
  }
  return true;
}

}  // namespace

std::string folderOf(const std::string& path) { return path.substr(0, path.rfind('/')); }
std::string nameOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

LoadWorker::LoadWorker(LoadOptions options, int number)
    : options_(std::move(options)),
      number_(number),
      random_(options_.seed * 1000 + static_cast<std::uint64_t>(number)) {}

void LoadWorker::begin() {
  for (std::size_t i = 0; i < folders_.size(); ++i) {
    const std::string name = "w" + std::to_string(number_) + "-" + kFolderNames.at(i);
    const auto made =
        host()->createDirectory(name, std::string(NSFileProviderRootContainerItemIdentifier));
    ASSERT_EQ(made.error, nullptr) << made.error->description();
    folders_.at(i) = {.path = options_.root + "/" + name, .id = made.identifier};
  }
}

const ContentClient* LoadWorker::zarn() {
  try {
    if (!zarn_) zarn_.emplace(options_.home);
  } catch (const std::exception&) {
    return nullptr;
  }
  return &*zarn_;
}

const HostClient* LoadWorker::host() {
  try {
    if (!host_) host_.emplace(options_.home);
  } catch (const std::exception&) {
    return nullptr;
  }
  return &*host_;
}

void LoadWorker::forgetConnections() {
  zarn_.reset();
  host_.reset();
}

bool LoadWorker::step() {
  constexpr std::array<Operation, 24> kOperations{
      &LoadWorker::overwrite,  &LoadWorker::overwrite,  &LoadWorker::overwrite,
      &LoadWorker::saveSafely, &LoadWorker::saveSafely, &LoadWorker::saveSafely,
      &LoadWorker::rename,     &LoadWorker::rename,     &LoadWorker::move,
      &LoadWorker::move,       &LoadWorker::trash,      &LoadWorker::remove,
      &LoadWorker::evict,      &LoadWorker::evict,      &LoadWorker::evict,
      &LoadWorker::evict,      &LoadWorker::evict,      &LoadWorker::provide,
      &LoadWorker::provide,    &LoadWorker::provide,    &LoadWorker::read,
      &LoadWorker::read,       &LoadWorker::read,       &LoadWorker::askWhetherConfirmed};
  if (documents_.size() < options_.documents) return create();
  const auto document =
      std::next(documents_.begin(), static_cast<std::ptrdiff_t>(pick(documents_.size())));
  if (document->isUncertain) return false;
  if (document->isInTrash) return untrash(*document);
  return (this->*kOperations.at(pick(kOperations.size())))(*document);
}

bool LoadWorker::succeeded(Document& document, const char* what) {
  ++done_[what];
  document.history += std::string(" ") + what;
  return true;
}

bool LoadWorker::leftUncertain(Document& document, const std::string& mayBeAt) {
  document.isUncertain = true;
  document.mayBeAt = mayBeAt;
  document.history += " ?" + nameOf(mayBeAt);
  forgetConnections();
  return false;
}

/// Whether the drive has seen the document where it is. Programs cannot tell; the test waits, since
/// nobody could know a document again that was moved and replaced unseen.
bool LoadWorker::isKnown(Document& document) {
  if (zarn() == nullptr) return false;
  try {
    const std::string id = zarn_->identifierAt(document.path);
    if (document.id.empty()) document.id = id;
    EXPECT_TRUE(id.empty() || id == document.id) << document.description() << " is " << id;
    return !id.empty();
  } catch (const std::exception&) {
    forgetConnections();
    return false;
  }
}

Version LoadWorker::newVersion() {
  constexpr std::array<std::size_t, 4> kLargest{4097, 20'000, 300'000, 2'500'000};
  const std::uint64_t kind = std::min<std::uint64_t>(pick(10) / 3, options_.mayLosePower ? 2 : 3);
  const std::size_t largest = kLargest.at(kind);
  return {.seed = static_cast<std::uint32_t>(random_()), .size = pick(largest)};
}

std::string LoadWorker::newName(int number) {
  return "d" + std::to_string(number) + "-" + std::to_string(++lastName_) + ".bin";
}

bool LoadWorker::create() {
  Document document;
  document.number = ++lastDocument_ * 10 + number_;
  const Folder& folder = folders_.at(pick(folders_.size()));
  document.path = folder.path + "/" + newName(document.number);
  document.versions.push_back(newVersion());
  if (pick(2) == 0) return createByWriting(documents_.emplace_back(std::move(document)));
  return createByImport(document, folder);
}

bool LoadWorker::createByWriting(Document& document) {
  const FileDescriptor file(
      open(document.path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
  const bool isWritten = file && writeAll(file.get(), document.content().bytes());
  EXPECT_TRUE(isWritten || isCut()) << document.path;
  if (pick(2) == 0 && isWritten && fsync(file.get()) == 0 && !isCut()) document.becameDurable();
  return isWritten && succeeded(document, "create");
}

bool LoadWorker::createByImport(Document& document, const Folder& folder) {
  if (host() == nullptr) return false;
  const std::string source = options_.outside + "/" + nameOf(document.path);
  std::ofstream(source, std::ios::binary) << document.content().bytes();
  const auto imported = host()->importDocument(source, folder.id);
  std::filesystem::remove(source);
  document.id = imported.identifier;
  Document& kept = documents_.emplace_back(std::move(document));
  if (!imported.error && !isCut()) return succeeded(kept, "import");
  kept.mayBeGone = true;
  return leftUncertain(kept, {});
}

bool LoadWorker::overwrite(Document& document) {
  const bool replacesAll = pick(3) == 0;
  const FileDescriptor file(
      open(document.path.c_str(), O_RDWR | O_CLOEXEC | (replacesAll ? O_TRUNC : 0)));
  EXPECT_TRUE(file || isCut()) << document.path << " is not there";
  // Bytes that are written into a document that is away cannot be joined with those.
  if (!file || (!replacesAll && isMarkedAway(file.get(), options_.power->boot))) return false;
  document.versions.push_back(newVersion());
  document.isTorn = true;
  const std::string bytes = document.content().bytes();
  const bool isWritten =
      writeAll(file.get(), bytes) && ftruncate(file.get(), static_cast<off_t>(bytes.size())) == 0;
  EXPECT_TRUE(isWritten || isCut()) << document.path;
  if (pick(2) == 0 && isWritten && fsync(file.get()) == 0 && !isCut()) document.becameDurable();
  return isWritten && succeeded(document, replacesAll ? "replace" : "overwrite");
}

void LoadWorker::rewrite(Document& document) {
  const FileDescriptor file(open(document.path.c_str(), O_RDWR | O_CLOEXEC | O_TRUNC));
  document.versions.push_back(newVersion());
  ASSERT_TRUE(file && writeAll(file.get(), document.content().bytes()) && fsync(file.get()) == 0)
      << document.path;
  document.becameDurable();
}

bool LoadWorker::saveSafely(Document& document) {
  if (!isKnown(document)) return false;
  const std::string aside = document.path + ".new";
  const Version version = newVersion();
  {
    const FileDescriptor file(open(aside.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    const bool isSynced = file && writeAll(file.get(), version.bytes()) && fsync(file.get()) == 0;
    EXPECT_TRUE(isSynced || isCut()) << aside;
    if (!isSynced) return false;
  }
  document.versions.push_back(version);
  document.isIdSafe = false;  // it is another file from here on
  const bool isSaved = ::rename(aside.c_str(), document.path.c_str()) == 0;
  EXPECT_TRUE(isSaved || isCut()) << document.path;
  return isSaved && succeeded(document, "save");
}

bool LoadWorker::moveTo(Document& document, const Folder& folder, const std::string& name) {
  if (!isKnown(document)) return false;
  const std::string target = folder.path + "/" + name;
  if (pick(2) == 0) {
    const bool isMoved =
        renameat2(AT_FDCWD, document.path.c_str(), AT_FDCWD, target.c_str(), RENAME_NOREPLACE) == 0;
    EXPECT_TRUE(isMoved || isCut()) << document.path;
    if (!isMoved) return leftUncertain(document, target);
    document.path = target;
    return succeeded(document, "move around the drive");
  }
  if (host() == nullptr) return false;
  const bool isRename = folder.path == folderOf(document.path);
  const auto changed =
      isRename ? host()->rename(document.id, name) : host()->reparent(document.id, folder.id);
  if (changed.error || isCut()) return leftUncertain(document, target);
  EXPECT_EQ(changed.identifier, document.id);
  document.path = target;
  return succeeded(document, isRename ? "rename" : "move");
}

bool LoadWorker::rename(Document& document) {
  const std::string folder = folderOf(document.path);
  return moveTo(document, {.path = folder, .id = {}}, newName(document.number));
}

bool LoadWorker::move(Document& document) {
  const Folder& folder = folders_.at(pick(folders_.size()));
  if (folder.path == folderOf(document.path)) return false;
  return moveTo(document, folder, nameOf(document.path));
}

bool LoadWorker::trash(Document& document) {
  if (!isKnown(document) || host() == nullptr) return false;
  const NSErrorRef error =
      pick(2) == 0 ? host()->trash(document.id).error : zarn()->trash(document.path).error;
  if (error || isCut()) {
    document.mayBeInTrash = true;
    return leftUncertain(document, {});
  }
  document.isInTrash = true;
  return succeeded(document, "trash");
}

bool LoadWorker::untrash(Document& document) {
  if (document.id.empty() || host() == nullptr) return false;
  const NSErrorRef error = host()->untrash(document.id).error;
  if (error || isCut()) return leftUncertain(document, {});
  document.isInTrash = false;
  return succeeded(document, "untrash");
}

bool LoadWorker::remove(Document& document) {
  if (options_.mayLosePower || !isKnown(document) || host() == nullptr) return false;
  const NSErrorRef error = host()->remove(document.id).error;
  if (error) {
    document.mayBeGone = true;
    return leftUncertain(document, {});
  }
  ++done_["remove"];
  documents_.remove_if([&](const Document& other) { return &other == &document; });
  return true;
}

bool LoadWorker::evict(Document& document) {
  if (zarn() == nullptr || host() == nullptr) return false;
  const bool asksHost = pick(3) == 0;
  const NSErrorRef error =
      asksHost ? host()->stopProviding(document.path) : zarn()->evict(document.path);
  if (error) {
    const bool isRefusal = error->is(QSOstrellErrorDomain, QSOstrellErrorCannotEvict) ||
                           error->is(NSPOSIXErrorDomain, EBUSY);
    if (isRefusal) return false;
    mayEvictLater_ = true;
    forgetConnections();
    return false;
  }
  return succeeded(document, asksHost ? "stop providing" : "evict");
}

bool LoadWorker::provide(Document& document) {
  if (zarn() == nullptr || host() == nullptr) return false;
  const bool asksHost = pick(2) == 0;
  HostClient::Need need;
  const NSErrorRef error =
      asksHost ? host()->provide(document.path, need) : zarn()->provide(document.path);
  if (error) {
    forgetConnections();
    return false;
  }
  const Reading reading = readAt(document.path, options_.power->boot);
  EXPECT_TRUE(reading.kind == Reading::Kind::Content || mayEvictLater_ || isCut())
      << document.path << " was provided, and is away";
  expectContent(document, reading, "provided");
  return succeeded(document, "provide");
}

bool LoadWorker::read(Document& document) {
  const Reading reading = readAt(document.path, options_.power->boot);
  EXPECT_TRUE(reading.kind != Reading::Kind::Nothing || isCut()) << document.path << " is gone";
  expectContent(document, reading, "read");
  return succeeded(document, "read");
}

bool LoadWorker::askWhetherConfirmed(Document& document) {
  if (zarn() == nullptr) return false;
  const auto state = zarn()->state(document.path);
  if (state.error) {
    forgetConnections();
    return false;
  }
  if (state.upload != ContentClient::Upload::CONFIRMED || isCut()) return false;
  document.becameDurable();
  document.isIdSafe = !document.id.empty();
  return succeeded(document, "ask");
}

void LoadWorker::expectContent(const Document& document, const Reading& reading,
                               const char* when) const {
  if (reading.kind != Reading::Kind::Content || isCut()) return;
  EXPECT_TRUE(reading.bytes == document.content().bytes())
      << document.description() << " was " << when << " with " << reading.bytes.size()
      << " bytes that are not its " << document.content().size << " bytes";
}

}  // namespace yomber::testing
