#include "provider/testing/collected_log.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <optional>

#include "platform/foundation/lock.h"
#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

constexpr std::string_view kHexadecimal = "0123456789abcdef";
constexpr std::array<std::string_view, 4> kGlyphs{"┏", "┣", "┳", "┗"};
constexpr auto kPatience = std::chrono::seconds(10);

/// Where the section's number is in a line, and how long it is.
struct SectionNumber {
  std::size_t begin = 0;
  std::size_t length = 0;
};

std::optional<SectionNumber> findSectionNumber(std::string_view line) {
  for (const auto glyph : kGlyphs) {
    const auto at = line.find(glyph);
    if (at == std::string_view::npos) continue;
    const auto begin = at + glyph.size();
    const auto end = std::min(line.find_first_not_of(kHexadecimal, begin), line.size());
    return SectionNumber{.begin = begin, .length = end - begin};
  }
  return std::nullopt;
}

std::string withoutNumber(std::string line) {
  if (const auto number = findSectionNumber(line)) line.replace(number->begin, number->length, "#");
  return line;
}

}  // namespace

class CollectedLog::Collector : public Log::Sink {
 public:
  void write(LogLevel level, std::string_view line) override {
    LockGuard guard(_lock);
    _lines.push_back({.level = level, .text = std::string(line)});
    _changed.notifyAll();
  }
  std::vector<CollectedLine> lines() const {
    LockGuard guard(_lock);
    return _lines;
  }
  void forget() {
    LockGuard guard(_lock);
    _lines.clear();
  }
  std::size_t count(LogLevel level, std::string_view text) const {
    LockGuard guard(_lock);
    return countLocked(level, text);
  }
  bool waitFor(LogLevel level, std::string_view text, std::size_t count) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    LockGuard guard(_lock);
    while (countLocked(level, text) < count) {
      if (!_changed.waitUntil(_lock, deadline)) return countLocked(level, text) >= count;
    }
    return true;
  }

 private:
  std::size_t countLocked(LogLevel level, std::string_view text) const REQUIRES(_lock) {
    std::size_t result = 0;
    for (const auto& line : _lines) {
      if (line.level == level && withoutNumber(line.text) == text) ++result;
    }
    return result;
  }

  mutable Mutex _lock;
  Condition _changed;
  std::vector<CollectedLine> _lines GUARDED_BY(_lock);
};

CollectedLog::CollectedLog() : _collector(std::make_shared<Collector>()) {
  qsc_default_log().setSink(_collector);
  qsc_default_log().setLevel(LogLevel::Debug);
}

CollectedLog::~CollectedLog() {
  qsc_default_log().setLevel(LogLevel::Info);
  qsc_default_log().setSink(nullptr);
}

void CollectedLog::setLevel(LogLevel level) { qsc_default_log().setLevel(level); }

void CollectedLog::forget() { _collector->forget(); }

std::vector<CollectedLine> CollectedLog::lines() const { return _collector->lines(); }

std::vector<std::string> CollectedLog::texts() const {
  std::vector<std::string> result;
  for (auto& line : lines()) result.push_back(withoutNumber(std::move(line.text)));
  return result;
}

std::size_t CollectedLog::count(LogLevel level, std::string_view text) const {
  return _collector->count(level, text);
}

std::size_t CollectedLog::countContaining(std::string_view part) const {
  std::size_t result = 0;
  for (const auto& line : lines()) {
    if (line.text.find(part) != std::string::npos) ++result;
  }
  return result;
}

std::uint64_t CollectedLog::sectionOf(std::string_view text) const {
  for (const auto& line : lines()) {
    if (withoutNumber(line.text) != text) continue;
    const auto number = findSectionNumber(line.text);
    if (!number) continue;
    std::uint64_t value = 0;
    const char* const begin = line.text.data() + number->begin;
    std::from_chars(begin, begin + number->length, value, 16);
    return value;
  }
  return 0;
}

bool CollectedLog::waitFor(LogLevel level, std::string_view text, std::size_t count) const {
  return _collector->waitFor(level, text, count);
}

std::vector<std::string> among(const std::vector<std::string>& texts,
                               const std::vector<std::string>& wanted) {
  std::vector<std::string> result;
  for (const auto& text : texts) {
    if (std::find(wanted.begin(), wanted.end(), text) != wanted.end()) result.push_back(text);
  }
  return result;
}

}  // namespace yomber
