#include "platform/foundation/log_sinks.h"

#include <spdlog/pattern_formatter.h>
#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/sinks/systemd_sink.h>
#include <spdlog/spdlog.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <span>
#include <vector>

#include "platform/foundation/hexadecimal.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/log_level.h"

namespace yomber {
namespace {

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";
constexpr std::size_t kFileSize = std::size_t{10} * 1024 * 1024;
constexpr std::size_t kRotatedFiles = 2;  // beside the one that is written
constexpr std::chrono::seconds kFlushInterval{1};

spdlog::level::level_enum spdlogLevel(LogLevel level) {
  switch (level) {
    case LogLevel::Debug:
      return spdlog::level::debug;
    case LogLevel::Info:
      return spdlog::level::info;
    case LogLevel::Default:
      return spdlog::level::warn;
    case LogLevel::Error:
      return spdlog::level::err;
    case LogLevel::Fault:
      break;
  }
  return spdlog::level::critical;
}

LogLevel levelOf(spdlog::level::level_enum level) {
  switch (level) {
    case spdlog::level::debug:
      return LogLevel::Debug;
    case spdlog::level::info:
      return LogLevel::Info;
    case spdlog::level::warn:
      return LogLevel::Default;
    case spdlog::level::err:
      return LogLevel::Error;
    default:
      return LogLevel::Fault;
  }
}

/// Our own names of the levels, where the pattern has "%*".
class LevelFlag final : public spdlog::custom_flag_formatter {
 public:
  void format(const spdlog::details::log_msg& message, const std::tm&,
              spdlog::memory_buf_t& out) override {
    const auto name = logLevelName(levelOf(message.level));
    out.append(name.data(), name.data() + name.size());
  }
  [[nodiscard]] std::unique_ptr<custom_flag_formatter> clone() const override {
    return spdlog::details::make_unique<LevelFlag>();
  }
};

std::unique_ptr<spdlog::formatter> lineFormatter(const std::string& program) {
  auto formatter = std::make_unique<spdlog::pattern_formatter>(spdlog::pattern_time_type::utc);
  formatter->add_flag<LevelFlag>('*');
  formatter->set_pattern("%Y-%m-%dT%H:%M:%S.%fZ %* " + program + "[%P:%t] %v");
  return formatter;
}

class JournalSink final : public spdlog::sinks::systemd_sink_mt {
 public:
  explicit JournalSink(const std::string& identifier) : systemd_sink(identifier) {
    syslog_levels_[spdlog::level::warn] = LOG_NOTICE;  // where level default goes
  }
};

bool isControl(char c) {
  const auto byte = static_cast<unsigned char>(c);
  return byte < 0x20 || byte == 0x7f;
}

std::string escaped(std::string_view line) {
  std::string out;
  out.reserve(line.size() + 8);
  for (const char c : line) {
    if (!isControl(c)) {
      out += c;
    } else if (c == '\n') {
      out += "\\n";
    } else {
      out += "\\x" + hexadecimal(std::as_bytes(std::span(&c, 1)));
    }
  }
  return out;
}

class SpdlogSink final : public Log::Sink {
 public:
  explicit SpdlogSink(std::vector<spdlog::sink_ptr> sinks)
      : logger_(std::make_shared<spdlog::logger>(freshName(), sinks.begin(), sinks.end())) {
    logger_->set_level(spdlog::level::trace);
    logger_->flush_on(spdlogLevel(LogLevel::Default));
    spdlog::register_logger(logger_);  // which is what the regular flush goes by
    spdlog::flush_every(kFlushInterval);
  }
  ~SpdlogSink() override {
    logger_->flush();
    spdlog::drop(logger_->name());
  }

  void write(LogLevel level, std::string_view line) override {
    const bool clean = std::none_of(line.begin(), line.end(), isControl);
    const std::string storage = clean ? std::string() : escaped(line);
    const std::string_view text = clean ? line : std::string_view(storage);
    logger_->log(spdlogLevel(level), spdlog::string_view_t(text.data(), text.size()));
  }

 private:
  static std::string freshName() {
    static std::atomic<unsigned> last{0};
    return "yomber-" + std::to_string(++last);
  }

  const std::shared_ptr<spdlog::logger> logger_;
};

/// Pages are never unmapped: the log reads them until the process ends.
const std::atomic<std::uint8_t>* lastingLevel(std::unique_ptr<LogLevelPage> page) {
  static Mutex& mutex = *new Mutex;
  static auto& pages = *new std::vector<std::unique_ptr<LogLevelPage>>;
  LockGuard guard(mutex);
  pages.push_back(std::move(page));
  return pages.back()->cell();
}

std::vector<spdlog::sink_ptr> openSinks(const LogTargets& targets) {
  std::vector<spdlog::sink_ptr> sinks;
  if (!targets.journalIdentifier.empty()) {
    sinks.push_back(std::make_shared<JournalSink>(targets.journalIdentifier));
  }
  if (!targets.directory.empty()) {
    sinks.push_back(std::make_shared<spdlog::sinks::rotating_file_sink_mt>(
        targets.directory + "/" + targets.program + ".log", kFileSize, kRotatedFiles));
    sinks.back()->set_formatter(lineFormatter(targets.program));
  }
  if (targets.standardError) {
    sinks.push_back(std::make_shared<spdlog::sinks::stderr_sink_mt>());
    sinks.back()->set_formatter(lineFormatter(targets.program));
  }
  return sinks;
}

bool wantsStandardError() {
  const char* const wish = std::getenv("YOMBER_LOG_STDERR");
  return wish != nullptr && std::string_view(wish) == "1";
}

}  // namespace

std::shared_ptr<Log::Sink> makeLogSink(const LogTargets& targets, NSErrorRef* error) {
  try {
    return std::make_shared<SpdlogSink>(openSinks(targets));
  } catch (const std::exception& failure) {
    storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSFileWriteUnknownError,
                                               {{NSFilePathErrorKey, targets.directory},
                                                {NSLocalizedDescriptionKey, failure.what()}}));
    return nullptr;
  }
}

bool logsToJournal() { return access(kJournalSocket, W_OK) == 0; }

std::string journalIdentifier(const std::string& program, const DrivePaths& paths) {
  return "yomber-" + program + "-" + paths.homeHash;
}

void openLog(const std::string& program, const DrivePaths& paths) {
  LogTargets targets{.program = program, .standardError = wantsStandardError()};
  if (logsToJournal()) {
    targets.journalIdentifier = journalIdentifier(program, paths);
  } else {
    targets.directory = paths.log;
  }
  NSErrorRef sinkError;
  auto sink = makeLogSink(targets, &sinkError);
  if (sink == nullptr) sink = makeLogSink({.program = program, .standardError = true});
  defaultLog().setSink(std::move(sink));
  if (sinkError) {
    log_error(defaultLog(), "[ERROR] the log goes to standard error only: %@", sinkError);
  }

  NSErrorRef levelError;
  if (auto page = LogLevelPage::open(paths.logLevelPage, &levelError)) {
    defaultLog().attachLevel(lastingLevel(std::move(page)));
  } else {
    log_error(defaultLog(), "[ERROR] the log's level cannot be switched from outside: %@",
              levelError);
  }
}

}  // namespace yomber
