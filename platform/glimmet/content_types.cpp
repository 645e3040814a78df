#include "platform/glimmet/content_types.h"

#include <fnmatch.h>

#include <algorithm>
#include <bitset>
#include <charconv>
#include <fstream>
#include <functional>
#include <optional>
#include <unordered_map>
#include <vector>

namespace yomber {
namespace {

constexpr const char* kSystemGlobs = "/usr/share/mime/globs2";

std::string lowered(std::string_view text) {
  std::string result(text);
  std::transform(result.begin(), result.end(), result.begin(), [](char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
  });
  return result;
}

/// One line of `globs2`: "weight:type:pattern[:flags]".
struct GlobLine {
  int weight = 0;
  std::string type;
  std::string pattern;
  bool isCaseSensitive = false;
};

std::optional<GlobLine> parseGlobLine(std::string_view line) {
  if (line.empty() || line.front() == '#') return std::nullopt;
  const std::size_t first = line.find(':');
  const std::size_t second = first == std::string_view::npos ? first : line.find(':', first + 1);
  if (second == std::string_view::npos) return std::nullopt;
  GlobLine result;
  const auto [end, failure] = std::from_chars(line.data(), line.data() + first, result.weight);
  if (failure != std::errc() || end != line.data() + first) return std::nullopt;
  result.type = line.substr(first + 1, second - first - 1);
  const std::size_t third = line.find(':', second + 1);
  result.pattern =
      line.substr(second + 1, third == std::string_view::npos ? third : third - second - 1);
  result.isCaseSensitive =
      third != std::string_view::npos && line.substr(third).find("cs") != std::string_view::npos;
  if (result.pattern.empty() || result.type.empty()) return std::nullopt;
  return result;
}

bool hasWildcard(std::string_view pattern) {
  return pattern.find_first_of("*?[") != std::string_view::npos;
}

/// A text that every match of a pattern contains: the longest one before any bracket or backslash.
std::string_view literalOf(std::string_view pattern) {
  pattern = pattern.substr(0, pattern.find_first_of("[\\"));
  std::string_view longest;
  while (!pattern.empty()) {
    const std::size_t end = std::min(pattern.find_first_of("*?"), pattern.size());
    if (end > longest.size()) longest = pattern.substr(0, end);
    pattern.remove_prefix(std::min(end + 1, pattern.size()));
  }
  return longest;
}

using Bytes = std::bitset<256>;

/// The bytes that one element of a pattern (a letter, a bracket, a wildcard) can begin or end with.
Bytes bytesOf(const std::string& element) {
  const auto isPlain = [](char c) { return c > 0 && c != '*' && c != '?' && c != '\\'; };
  const bool isNegated = element.starts_with("[!") || element.starts_with("[^");
  if (element.empty() || isNegated || !std::ranges::all_of(element, isPlain)) return Bytes().set();
  Bytes bytes;
  for (char c = 1; c > 0 && c < 127; ++c) {
    if (fnmatch(element.c_str(), std::string(1, c).c_str(), 0) == 0) {
      bytes.set(static_cast<unsigned char>(c));
    }
  }
  return bytes;
}

Bytes firstBytesOf(const std::string& pattern) {
  // A bracket that is closed at once holds the closing one.
  if (pattern.front() == '[') return bytesOf(pattern.substr(0, pattern.find(']', 2) + 1));
  return bytesOf(pattern.substr(0, 1));
}

Bytes lastBytesOf(const std::string& pattern) {
  const bool isEscaped = pattern.find('\\') != std::string::npos;
  if (isEscaped) return Bytes().set();
  if (pattern.back() != ']') return bytesOf(pattern.substr(pattern.size() - 1));
  const std::size_t open = pattern.rfind('[');
  return bytesOf(open == std::string::npos ? "" : pattern.substr(open));
}

/// A pattern that is neither a name nor a suffix.
class Glob {
 public:
  explicit Glob(GlobLine line)
      : line_(std::move(line)),
        literal_(literalOf(line_.pattern)),
        first_(firstBytesOf(line_.pattern)),
        last_(lastBytesOf(line_.pattern)) {}

  [[nodiscard]] const GlobLine& line() const { return line_; }
  [[nodiscard]] bool matches(const std::string& text) const {
    return !text.empty() && first_[static_cast<unsigned char>(text.front())] &&
           last_[static_cast<unsigned char>(text.back())] &&
           text.find(literal_) != std::string::npos &&
           fnmatch(line_.pattern.c_str(), text.c_str(), 0) == 0;
  }

 private:
  GlobLine line_;
  // What spares most names the pattern.
  std::string literal_;
  Bytes first_;
  Bytes last_;
};

/// For keys that are parts of a name.
struct TextHash {
  using is_transparent = void;
  std::size_t operator()(std::string_view text) const {
    return std::hash<std::string_view>()(text);
  }
};

}  // namespace

const std::string ContentTypes::kFolder = "inode/directory";
const std::string ContentTypes::kSymlink = "inode/symlink";
const std::string ContentTypes::kUnknown = "application/octet-stream";

struct ContentTypes::Table {
  struct Match {
    int weight = 0;
    std::size_t length = 0;
    const std::string* type = nullptr;

    [[nodiscard]] bool isBelow(const Match& other) const {
      return std::pair(weight, length) < std::pair(other.weight, other.length);
    }
  };
  using ByText = std::unordered_map<std::string, GlobLine, TextHash, std::equal_to<>>;

  // Apart by whether letters' case counts; keys of the others are in lower case.
  ByText exactNames[2];
  ByText exactSuffixes[2];
  std::vector<Glob> globs;

  void add(GlobLine line) {
    if (!line.isCaseSensitive) line.pattern = lowered(line.pattern);
    const bool isSuffix =
        line.pattern.starts_with("*.") && !hasWildcard(std::string_view(line.pattern).substr(1));
    if (isSuffix) {
      exactSuffixes[line.isCaseSensitive].try_emplace(line.pattern.substr(1), line);
    } else if (!hasWildcard(line.pattern)) {
      exactNames[line.isCaseSensitive].try_emplace(line.pattern, line);
    } else {
      globs.emplace_back(std::move(line));
    }
  }

  static void consider(const GlobLine& line, Match& best) {
    const Match match{line.weight, line.pattern.size(), &line.type};
    if (best.type == nullptr || best.isBelow(match)) best = match;
  }

  static void look(const ByText& table, std::string_view key, Match& best) {
    if (const auto found = table.find(key); found != table.end()) consider(found->second, best);
  }

  [[nodiscard]] Match find(const std::string& name) const {
    const std::string lower = lowered(name);
    Match best;
    look(exactNames[true], name, best);
    look(exactNames[false], lower, best);
    for (std::size_t dot = name.find('.'); dot != std::string::npos;
         dot = name.find('.', dot + 1)) {
      look(exactSuffixes[true], std::string_view(name).substr(dot), best);
      look(exactSuffixes[false], std::string_view(lower).substr(dot), best);
    }
    for (const Glob& glob : globs) {
      if (glob.matches(glob.line().isCaseSensitive ? name : lower)) consider(glob.line(), best);
    }
    return best;
  }
};

ContentTypes::ContentTypes(const std::string& globsPath) : table_(std::make_unique<Table>()) {
  std::ifstream file(globsPath);
  for (std::string line; std::getline(file, line);) {
    if (auto parsed = parseGlobLine(line)) table_->add(std::move(*parsed));
  }
}

ContentTypes::~ContentTypes() = default;

const ContentTypes& ContentTypes::system() {
  static const ContentTypes types(kSystemGlobs);
  return types;
}

const std::string& ContentTypes::typeForName(std::string_view name) const {
  // A name cannot hold a zero byte on disk; one from elsewhere matches nothing.
  if (name.find('\0') != std::string_view::npos) return kUnknown;
  const Table::Match best = table_->find(std::string(name));
  return best.type != nullptr ? *best.type : kUnknown;
}

}  // namespace yomber
