#include "platform/rozzel/embedded_store.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace yomber {

namespace {

/// Connections kept for the next call; more exist only while more calls run at once.
constexpr std::size_t kIdleConnections = 4;

[[noreturn]] void throwOutOfReach(const std::string& reason) {
  throwFailure(RZErrorNetworkUnavailable, "the record store is out of reach: " + reason);
}

}  // namespace

EmbeddedEngine::Store::Store(std::string folder, EmbeddedEngineOptions options)
    : assets_(std::move(folder)), options_(std::move(options)) {}

NSDate EmbeddedEngine::Store::now() const {
  return options_.clock ? options_.clock() : NSDate::now();
}

EmbeddedEngine::Store::Identity EmbeddedEngine::Store::identify() const {
  const std::string& folder = assets_.storeFolder();
  if (access((folder + "/offline").c_str(), F_OK) == 0) {
    throwOutOfReach("it was switched off; remove " + folder + "/offline to go on");
  }
  // The effective user's rights are what counts for the calls that follow.
  if (faccessat(AT_FDCWD, folder.c_str(), R_OK | W_OK | X_OK, AT_EACCESS) != 0) {
    throwOutOfReach(folder + ": " + std::strerror(errno));
  }
  struct stat status{};
  const std::string database = folder + "/records.db";
  if (stat(database.c_str(), &status) != 0) {
    throwOutOfReach(database + ": " + std::strerror(errno));
  }
  return {.device = status.st_dev, .inode = status.st_ino};
}

EmbeddedEngine::Store::Lease EmbeddedEngine::Store::borrow() {
  const Identity identity = identify();
  std::vector<Lease> outdated;
  {
    LockGuard guard(mutex_);
    while (!idle_.empty()) {
      Lease lease = std::move(idle_.back());
      idle_.pop_back();
      if (lease.identity == identity) return lease;
      outdated.push_back(std::move(lease));
    }
  }
  auto connection = std::make_unique<RecordsConnection>(assets_.storeFolder() + "/records.db",
                                                        RecordsConnection::Missing::Fail,
                                                        options_.busyMilliseconds);
  prepareRecordsSchema(*connection);
  return {.identity = identity, .connection = std::move(connection)};
}

bool EmbeddedEngine::Store::isOfDatabase(const NSErrorRef& error) {
  switch (error->code()) {
    case RZErrorNetworkUnavailable:
    case RZErrorStoreTooNew:
    case RZErrorStoreDamaged:
    case RZErrorStoreFull:
    case RZErrorStoreFailure:
      return true;
    default:
      return false;
  }
}

void EmbeddedEngine::Store::giveBack(Lease lease) {
  if (!lease.connection->isIdle()) return;
  LockGuard guard(mutex_);
  if (idle_.size() < kIdleConnections) idle_.push_back(std::move(lease));
}

std::shared_ptr<StagingSession> EmbeddedEngine::Store::session() {
  requireReachable();
  LockGuard guard(mutex_);
  if (!session_ || !session_->isThere()) {
    session_.reset();
    session_ = std::make_shared<StagingSession>(assets_);
  }
  return session_;
}

}  // namespace yomber
