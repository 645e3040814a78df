#include "zarn/database.h"

#include <SQLiteCpp/Exception.h>
#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <ctime>
#include <deque>
#include <future>
#include <thread>

#include "platform/foundation/fault_points.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "zarn/bulk_load.h"
#include "zarn/busy_files.h"
#include "zarn/checkpointer.h"
#include "zarn/connection.h"
#include "zarn/recent_backups.h"
#include "zarn/schema.h"
#include "zarn/write_transaction.h"

namespace yomber {
namespace {

constexpr std::size_t kMaximumBatch = 256;
constexpr std::size_t kIdleReaders = 8;
constexpr std::uint64_t kRemovalsBetweenPrunings = 1000;
constexpr const char* kAsideSuffix = ".new";
constexpr const char* kSuspectSuffix = ".suspect";

FaultPoint beforeCommit("zarn.database.before-commit");
FaultPoint afterCommit("zarn.database.after-commit");
FaultPoint beforeSwap("zarn.database.before-swap");

NSErrorRef databaseError(std::int64_t code, const std::string& text) {
  return NSError::errorWithDomain(kDatabaseErrorDomain, code, {{NSLocalizedDescriptionKey, text}});
}

std::int64_t nowNanoseconds() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::duration_cast<std::chrono::nanoseconds>(now).count();
}

/// What the log and its index cannot grow for.
bool isLackOfRoom(const SQLite::Exception& exception) {
  const int code = exception.getExtendedErrorCode();
  return code == SQLITE_FULL || code == SQLITE_IOERR_SHMSIZE;
}

bool isDamage(const SQLite::Exception& exception) {
  const int code = exception.getErrorCode();
  return code == SQLITE_CORRUPT || code == SQLITE_NOTADB;
}

void removeWithCompanions(const std::string& path) {
  for (const char* suffix : {"", "-wal", "-shm", "-journal"}) unlink((path + suffix).c_str());
}

/// Moves a damaged file out of the way, where a person can look at it.
void setAside(const std::string& path, const std::string& reason) {
  std::array<char, 32> date{};
  const std::time_t now = std::time(nullptr);
  std::tm parts{};
  gmtime_r(&now, &parts);
  std::strftime(date.data(), date.size(), "%Y%m%dT%H%M%SZ", &parts);
  std::string aside = path + ".damaged-" + date.data();
  for (int number = 2; access(aside.c_str(), F_OK) == 0; ++number) {
    aside = path + ".damaged-" + date.data() + "-" + std::to_string(number);
  }
  for (const char* suffix : {"", "-wal", "-shm"}) {
    std::rename((path + suffix).c_str(), (aside + suffix).c_str());
  }
  log_error(
      defaultLog(),
      "[ERROR] the database cannot be read (%@); it is kept as %@ and built anew from the tree",
      reason, aside);
}

void syncFolderOf(const std::string& path) {
  const std::string folder = path.substr(0, path.rfind('/') + 1);
  const int descriptor = ::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (descriptor < 0) return;
  fsync(descriptor);
  close(descriptor);
}

void syncFile(const std::string& path) {
  const int descriptor = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (descriptor < 0) return;
  fsync(descriptor);
  close(descriptor);
}

}  // namespace

struct Database::State {
  struct Task {
    Job job;
    std::function<NSErrorRef()> alone;  ///< instead of a job: runs outside any transaction
    std::function<void(NSErrorRef)> done;
    NSErrorRef result;
  };

  explicit State(std::string file) : path(std::move(file)) {}

  const std::string path;
  std::atomic<std::uint64_t> rank{0};
  std::atomic<std::uint64_t> oldestRank{0};
  std::atomic<std::uint64_t> identity{0};
  std::atomic<bool> isComplete{false};

  // The writer thread's own.
  std::unique_ptr<Connection> writer;
  std::uint64_t removals = 0;
  int logPages = 0;

  Mutex queueMutex;
  Condition queueChanged;
  std::deque<Task> queue GUARDED_BY(queueMutex);
  bool isClosing GUARDED_BY(queueMutex) = false;

  Mutex readersMutex;
  Condition readerReturned;
  std::vector<std::unique_ptr<Connection>> idleReaders GUARDED_BY(readersMutex);
  std::size_t busyReaders GUARDED_BY(readersMutex) = 0;
  bool isSwapping GUARDED_BY(readersMutex) = false;

  Mutex sinksMutex;
  std::vector<std::weak_ptr<ChangeSink>> sinks GUARDED_BY(sinksMutex);
  std::weak_ptr<CommitParticipant> participant GUARDED_BY(sinksMutex);
  BusyFiles busyFiles;
  RecentBackups recentBackups;
  RecentlyGone recentlyGone;  // the writer's

  std::thread thread;
  Checkpointer checkpointer;

  void openWriter();
  NSErrorRef writeBack();
  void run();
  bool takeBatch(std::vector<Task>& batch);
  void runAlone(Task& task);
  void runBatch(std::vector<Task>& batch);
  void submit(Task task);
  NSErrorRef submitAndWait(Task task);
  void runTask(Task& task, WriteTransaction& transaction);
  void storeRank(WriteTransaction& transaction);
  std::function<void()> letParticipate(WriteTransaction& transaction);
  void publish(const WriteTransaction& transaction);
  [[nodiscard]] NSErrorRef failure(const std::exception& exception);
  std::unique_ptr<Connection> takeReader();
  void returnReader(std::unique_ptr<Connection> reader);
  NSErrorRef swapIn(const std::string& aside);
};

void Database::State::openWriter() {
  writer = std::make_unique<Connection>(path, Connection::Mode::Write);
  const auto noteLog = [](void* state, sqlite3*, const char*, int pages) {
    static_cast<State*>(state)->logPages = pages;
    return SQLITE_OK;
  };
  sqlite3_wal_hook(writer->database().getHandle(), noteLog, this);
  prepareSchema(*writer);
  identity = static_cast<std::uint64_t>(metaInteger(*writer, meta::kIdentity));
  rank = std::max(rank.load(), static_cast<std::uint64_t>(metaInteger(*writer, meta::kRank)));
  oldestRank = static_cast<std::uint64_t>(metaInteger(*writer, meta::kOldestRank));
  isComplete = metaInteger(*writer, meta::kIsComplete) == 1;
}

NSErrorRef Database::State::failure(const std::exception& exception) {
  const auto* const sqlite = dynamic_cast<const SQLite::Exception*>(&exception);
  if (sqlite != nullptr && isDamage(*sqlite)) {
    // The next start looks at the whole file; what is open goes on as far as it can.
    const std::string mark = path + kSuspectSuffix;
    const int descriptor = ::open(mark.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    if (descriptor >= 0) close(descriptor);
    log_fault(defaultLog(), "[CRIT] the database is damaged (%@); restart zarn to build it anew",
              exception.what());
  }
  if (sqlite != nullptr && isLackOfRoom(*sqlite)) return NSError::errorWithErrno(ENOSPC, path);
  return databaseError(kDatabaseFailure, exception.what());
}

bool Database::State::takeBatch(std::vector<Task>& batch) {
  LockGuard guard(queueMutex);
  while (queue.empty() && !isClosing) queueChanged.wait(queueMutex);
  while (!queue.empty() && batch.size() < kMaximumBatch) {
    if (queue.front().alone && !batch.empty()) break;
    batch.push_back(std::move(queue.front()));
    queue.pop_front();
    if (batch.back().alone) break;
  }
  return !batch.empty();
}

void Database::State::run() {
  for (std::vector<Task> batch; takeBatch(batch); batch.clear()) {
    if (batch.front().alone) {
      runAlone(batch.front());
    } else {
      runBatch(batch);
    }
    for (Task& task : batch) {
      if (task.done) task.done(task.result);
    }
  }
}

void Database::State::runAlone(Task& task) {
  try {
    task.result = task.alone();
  } catch (const std::exception& exception) {
    task.result = failure(exception);
  }
}

void Database::State::runBatch(std::vector<Task>& batch) {
  if (!writer) {
    const NSErrorRef error =
        databaseError(kDatabaseClosed, "The database could not be opened again; restart zarn.");
    for (Task& task : batch) task.result = error;
    return;
  }
  WriteTransaction transaction(*writer, rank, nowNanoseconds(), busyFiles, recentBackups,
                               recentlyGone);
  std::function<void()> afterwards;
  try {
    // A reader that meets a half-written header of the log holds the writer's lock for an instant;
    // only here is it waited for, not once something was read.
    writer->execute("BEGIN IMMEDIATE");
    for (Task& task : batch) runTask(task, transaction);
    afterwards = letParticipate(transaction);
    storeRank(transaction);
    if (beforeCommit.hit()) throw std::runtime_error("the disk is full");
    writer->execute("COMMIT");
  } catch (const std::exception& exception) {
    const NSErrorRef error = failure(exception);
    for (Task& task : batch) {
      if (!task.result) task.result = error;
    }
    try {
      if (sqlite3_get_autocommit(writer->database().getHandle()) == 0) writer->execute("ROLLBACK");
    } catch (const std::exception& second) {
      log_error(defaultLog(), "[ERROR] a transaction could not be undone: %@", second.what());
    }
    return;
  }
  (void)afterCommit.hit();
  rank = transaction.rank();
  if (afterwards) afterwards();
  publish(transaction);
  if (checkpointer.didCommit(logPages)) {
    (void)sqlite3_wal_checkpoint_v2(writer->database().getHandle(), nullptr,
                                    SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
  }
}

std::function<void()> Database::State::letParticipate(WriteTransaction& transaction) {
  if (transaction.changes().empty() && transaction.touched().empty()) return {};
  std::shared_ptr<CommitParticipant> strong;
  {
    LockGuard guard(sinksMutex);
    strong = participant.lock();
  }
  return strong ? strong->willCommit(transaction) : std::function<void()>();
}

/// On the checkpointer's thread.
NSErrorRef Database::State::writeBack() {
  std::unique_ptr<Connection> reader;
  NSErrorRef error;
  try {
    // Keeps the file from being swapped. Itself it cannot write.
    reader = takeReader();
    Connection connection(path, Connection::Mode::Write);
    sqlite3* const handle = connection.database().getHandle();
    const int result =
        sqlite3_wal_checkpoint_v2(handle, nullptr, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
    if (result != SQLITE_OK && result != SQLITE_BUSY) throw SQLite::Exception(handle, result);
  } catch (const std::exception& exception) {
    error = failure(exception);
  }
  if (reader) returnReader(std::move(reader));
  return error;
}

void Database::State::runTask(Task& task, WriteTransaction& transaction) {
  const auto mark = transaction.mark();
  writer->execute("SAVEPOINT job");
  try {
    task.result = task.job(transaction);
  } catch (const std::exception& exception) {
    task.result = failure(exception);
  }
  if (task.result) {
    writer->execute("ROLLBACK TO job");
    transaction.rewind(mark);
  }
  writer->execute("RELEASE job");
}

void Database::State::storeRank(WriteTransaction& transaction) {
  if (transaction.rank() == rank) return;
  for (const ItemChange& change : transaction.changes()) removals += change.isDead() ? 1 : 0;
  if (removals >= kRemovalsBetweenPrunings) {
    removals = 0;
    if (const std::uint64_t lost = transaction.prune(); lost != 0) {
      setMetaInteger(*writer, meta::kOldestRank, static_cast<std::int64_t>(lost));
      oldestRank = lost;
    }
  }
  setMetaInteger(*writer, meta::kRank, static_cast<std::int64_t>(transaction.rank()));
}

void Database::State::publish(const WriteTransaction& transaction) {
  if (transaction.changes().empty() && transaction.touched().empty()) return;
  std::vector<std::shared_ptr<ChangeSink>> live;
  {
    LockGuard guard(sinksMutex);
    std::erase_if(sinks, [&](const std::weak_ptr<ChangeSink>& sink) {
      auto strong = sink.lock();
      if (!strong) return true;
      live.push_back(std::move(strong));
      return false;
    });
  }
  for (const auto& sink : live) {
    if (!transaction.changes().empty()) sink->committed(transaction.changes());
    if (!transaction.touched().empty()) sink->touched(transaction.touched());
  }
}

std::unique_ptr<Connection> Database::State::takeReader() {
  {
    LockGuard guard(readersMutex);
    while (isSwapping) readerReturned.wait(readersMutex);
    ++busyReaders;
    if (!idleReaders.empty()) {
      auto reader = std::move(idleReaders.back());
      idleReaders.pop_back();
      return reader;
    }
  }
  try {
    return std::make_unique<Connection>(path, Connection::Mode::Read);
  } catch (...) {
    returnReader(nullptr);
    throw;
  }
}

void Database::State::returnReader(std::unique_ptr<Connection> reader) {
  LockGuard guard(readersMutex);
  --busyReaders;
  if (reader && !isSwapping && idleReaders.size() < kIdleReaders) {
    idleReaders.push_back(std::move(reader));
  }
  readerReturned.notifyAll();
}

NSErrorRef Database::State::swapIn(const std::string& aside) {
  {
    LockGuard guard(readersMutex);
    isSwapping = true;
    while (busyReaders != 0) readerReturned.wait(readersMutex);
    idleReaders.clear();
  }
  NSErrorRef error;
  try {
    writer.reset();
    removeWithCompanions(path);
    if (std::rename(aside.c_str(), path.c_str()) != 0) error = NSError::errorWithErrno(errno, path);
    syncFolderOf(path);
    openWriter();
  } catch (const std::exception& exception) {
    error = failure(exception);
  }
  LockGuard guard(readersMutex);
  isSwapping = false;
  readerReturned.notifyAll();
  return error;
}

Database::Database(std::shared_ptr<State> state) : state_(std::move(state)) {
  State* const running = state_.get();
  running->thread = std::thread([state = state_] { state->run(); });
  running->checkpointer.start([running] { return running->writeBack(); });
}

Database::~Database() {
  {
    LockGuard guard(state_->queueMutex);
    state_->isClosing = true;
    state_->queueChanged.notifyAll();
  }
  // The last reference may go in what the writer calls, which then outlives us.
  if (state_->thread.get_id() == std::this_thread::get_id()) {
    state_->thread.detach();
  } else {
    state_->thread.join();
  }
  state_->checkpointer.end();
}

namespace {

/// Whether a file under suspicion is whole.
bool isSound(const std::string& path) {
  Connection connection(path, Connection::Mode::Read);
  Statement check(connection.database(), "PRAGMA quick_check(1)");
  return check.step() && check.bytes(0) == "ok";
}

}  // namespace

std::shared_ptr<Database> Database::open(const std::string& path, NSErrorRef* error) {
  removeWithCompanions(path + kAsideSuffix);
  const std::string suspect = path + kSuspectSuffix;
  for (const bool isSecondTry : {false, true}) {
    auto state = std::make_shared<State>(path);
    try {
      if (access(suspect.c_str(), F_OK) == 0 && access(path.c_str(), F_OK) == 0 && !isSound(path)) {
        throw SQLite::Exception("a check found it malformed", SQLITE_CORRUPT);
      }
      unlink(suspect.c_str());
      state->openWriter();
      return std::shared_ptr<Database>(new Database(std::move(state)));
    } catch (const SchemaTooNew& newer) {
      storeError(
          error,
          databaseError(kDatabaseTooNew,
                        "The database " + path + " has version " + std::to_string(newer.version) +
                            ", this program reads up to " + std::to_string(kSchemaVersion) +
                            ". Use the newer program, or move the file away to have it "
                            "built anew from the files."));
      return nullptr;
    } catch (const SQLite::Exception& exception) {
      state.reset();
      if (!isDamage(exception) || isSecondTry) {
        storeError(error, databaseError(kDatabaseFailure, path + ": " + exception.what()));
        return nullptr;
      }
      unlink(suspect.c_str());
      setAside(path, exception.what());
    }
  }
  return nullptr;
}

void Database::State::submit(Task task) {
  LockGuard guard(queueMutex);
  queue.push_back(std::move(task));
  queueChanged.notifyOne();
}

NSErrorRef Database::State::submitAndWait(Task task) {
  std::promise<NSErrorRef> promise;
  auto result = promise.get_future();
  task.done = [&promise](NSErrorRef error) { promise.set_value(std::move(error)); };
  submit(std::move(task));
  return result.get();
}

NSErrorRef Database::write(const Job& job) {
  return state_->submitAndWait({.job = job, .alone = {}, .done = {}, .result = nullptr});
}

void Database::writeLater(Job job, std::function<void(NSErrorRef)> done) {
  state_->submit({.job = std::move(job), .alone = {}, .done = std::move(done), .result = nullptr});
}

NSErrorRef Database::makeDurable() const {
  // What the log does not hold any more was synced before it left it. (SQLite keeps no lock on the
  // log that closing it here would drop.)
  const std::string log = state_->path + "-wal";
  const FileDescriptor file(::open(log.c_str(), O_RDONLY | O_CLOEXEC));
  const bool isDurable = file ? fdatasync(file.get()) == 0 : errno == ENOENT;
  return isDurable ? nullptr : NSError::errorWithErrno(errno, log);
}

NSErrorRef Database::read(const Read& job) const {
  std::unique_ptr<Connection> reader;
  NSErrorRef error;
  try {
    reader = state_->takeReader();
    job(*reader);
  } catch (const std::exception& exception) {
    error = state_->failure(exception);
    if (!reader) return error;
    reader.reset();
  }
  state_->returnReader(std::move(reader));
  return error;
}

NSErrorRef Database::rebuild(const std::function<NSErrorRef(BulkLoad&)>& load) {
  State& state = *state_;
  const std::string aside = state.path + kAsideSuffix;
  const auto build = [&]() -> NSErrorRef {
    removeWithCompanions(aside);
    {
      BulkLoad bulk(aside, std::max(state.rank.load(), initialRank()), nowNanoseconds());
      if (NSErrorRef error = load(bulk)) return error;
      bulk.finish();
    }
    syncFile(aside);
    if (beforeSwap.hit()) return databaseError(kDatabaseFailure, "the disk is full");
    return state.swapIn(aside);
  };
  const NSErrorRef error =
      state.submitAndWait({.job = {}, .alone = build, .done = {}, .result = nullptr});
  if (error) removeWithCompanions(aside);
  return error;
}

void Database::setParticipant(std::weak_ptr<CommitParticipant> participant) {
  LockGuard guard(state_->sinksMutex);
  state_->participant = std::move(participant);
}

BusyFiles& Database::busyFiles() const { return state_->busyFiles; }
RecentBackups& Database::recentBackups() const { return state_->recentBackups; }

void Database::addSink(std::weak_ptr<ChangeSink> sink) {
  LockGuard guard(state_->sinksMutex);
  state_->sinks.push_back(std::move(sink));
}

bool Database::needsFirstScan() const { return !state_->isComplete; }
std::uint64_t Database::currentRank() const { return state_->rank; }
std::uint64_t Database::oldestAnswerableRank() const { return state_->oldestRank; }
std::uint64_t Database::identity() const { return state_->identity; }

}  // namespace yomber
